#include "daemon/engine/capture-time.h"
