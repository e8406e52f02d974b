#include "daemon/engine/rotation.h"
