#include "upload/device_context.h"

#include "util/lock.h"

namespace fbf {

DeviceContext::DeviceContext(const DeviceInfo& info, std::string daemonNameAndVersion)
    : locale_(info.localeIdentifier()),
      country_(info.countryCode()),
      model_(info.value("ProductType")),
      osVersion_(info.value("BuildVersion")),
      daemonNameAndVersion_(std::move(daemonNameAndVersion)) {
  auto v = [&](const char* key) { return info.value(key).value_or(""); };
  deviceString_ = v("ProductType") + "; " + v("ProductName") + " " + v("ProductVersion") + " " + v("BuildVersion");
}

std::string DeviceContext::userAgent() const {
  if (daemonNameAndVersion_.empty()) FBF_FATAL("the daemon name-and-version string is empty");
  return "vireond/1.0 (" + deviceString_ + ") " + daemonNameAndVersion_;
}

}  // namespace fbf
