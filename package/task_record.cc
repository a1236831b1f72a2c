#include "task_record.h"

#include "klibc/process.h"

namespace KIVO_PACKAGE {

bool TaskProcessAlive(const Json::Value& data) {
  return data.isObject() && data["pid"].isInt() && KLIBCProcAlive(data["pid"].asInt()) == 1;
}

}  // namespace KIVO_PACKAGE
