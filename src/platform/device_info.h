// Facts about the device and the user's locale.
//
// Keys: "ProductType" (DMI product name), "ProductName" and "ProductVersion"
// (/etc/os-release NAME and VERSION_ID), "BuildVersion" (BUILD_ID, else
// VERSION_ID, else the kernel release). Locale and country come from the
// process locale (LANG / LC_ALL) through ICU.
// Thread-safety: implementations are immutable after construction.
#pragma once

#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace fbf {

class DeviceInfo {
 public:
  virtual ~DeviceInfo() = default;
  virtual std::optional<std::string> value(std::string_view key) const = 0;
  virtual std::optional<std::string> localeIdentifier() const = 0;
  virtual std::optional<std::string> countryCode() const = 0;
};

struct DeviceInfoSources {
  std::filesystem::path osRelease = "/etc/os-release";
  std::filesystem::path dmiProductName = "/sys/class/dmi/id/product_name";
};

std::unique_ptr<DeviceInfo> makeLinuxDeviceInfo(DeviceInfoSources sources = {});

}  // namespace fbf
