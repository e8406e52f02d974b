// The platform storage service's web utilities: what the NAS knows about
// the removable devices plugged into it.
#ifndef VELT_STORAGE_H
#define VELT_STORAGE_H

#include <json/value.h>

#include "velt/vlibc.h"

namespace VELT {
namespace QXS {
namespace STORAGE_WEBUTILS {

class VELT_API Storage {
 public:
  // Fills info with the USB devices: {"devices": [device, ...]}, each
  // device with "producer", "product" and "partitions" (each partition
  // with "share_name"); the rest of the layout is the platform's. Returns
  // 0, or negative with the platform's last error set (info is then null).
  // May be called from several threads.
  static int GetUSBInfo(Json::Value& info);
};

}  // namespace STORAGE_WEBUTILS
}  // namespace QXS
}  // namespace VELT

#endif
