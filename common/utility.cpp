#include "common/utility.h"

#include <json/writer.h>

namespace Plovo {

std::string JsonToString(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  return Json::writeString(builder, value);
}

}  // namespace Plovo
