#include "platform/device_info.h"

#include <sys/utsname.h>
#include <unicode/locid.h>

#include <fstream>
#include <map>

namespace fbf {
namespace {

std::map<std::string, std::string> readOsRelease(const std::filesystem::path& path) {
  std::map<std::string, std::string> out;
  std::ifstream in(path);
  std::string line;
  while (std::getline(in, line)) {
    auto eq = line.find('=');
    if (eq == std::string::npos || line[0] == '#') continue;
    std::string key = line.substr(0, eq), value = line.substr(eq + 1);
    if (value.size() >= 2 && (value.front() == '"' || value.front() == '\'') && value.back() == value.front()) {
      value = value.substr(1, value.size() - 2);
    }
    out[key] = value;
  }
  return out;
}

std::optional<std::string> firstLine(const std::filesystem::path& path) {
  std::ifstream in(path);
  std::string line;
  if (!std::getline(in, line)) return std::nullopt;
  while (!line.empty() && (line.back() == ' ' || line.back() == '\n')) line.pop_back();
  if (line.empty()) return std::nullopt;
  return line;
}

class LinuxDeviceInfo final : public DeviceInfo {
 public:
  explicit LinuxDeviceInfo(const DeviceInfoSources& src) {
    auto os = readOsRelease(src.osRelease);
    auto pick = [&](std::initializer_list<const char*> keys) -> std::optional<std::string> {
      for (const char* k : keys) {
        auto it = os.find(k);
        if (it != os.end() && !it->second.empty()) return it->second;
      }
      return std::nullopt;
    };
    productName_ = pick({"NAME"});
    productVersion_ = pick({"VERSION_ID"});
    buildVersion_ = pick({"BUILD_ID", "VERSION_ID"});
    if (!buildVersion_) {
      utsname u{};
      if (uname(&u) == 0) buildVersion_ = u.release;
    }
    productType_ = firstLine(src.dmiProductName);

    icu::Locale loc = icu::Locale::getDefault();
    if (!loc.isBogus()) {
      std::string lang = loc.getLanguage(), country = loc.getCountry();
      if (!lang.empty()) locale_ = country.empty() ? lang : lang + "_" + country;
      if (!country.empty()) country_ = country;
    }
  }

  std::optional<std::string> value(std::string_view key) const override {
    if (key == "ProductType") return productType_;
    if (key == "ProductName") return productName_;
    if (key == "ProductVersion") return productVersion_;
    if (key == "BuildVersion") return buildVersion_;
    return std::nullopt;
  }
  std::optional<std::string> localeIdentifier() const override { return locale_; }
  std::optional<std::string> countryCode() const override { return country_; }

 private:
  std::optional<std::string> productType_, productName_, productVersion_, buildVersion_, locale_, country_;
};

}  // namespace

std::unique_ptr<DeviceInfo> makeLinuxDeviceInfo(DeviceInfoSources sources) {
  return std::make_unique<LinuxDeviceInfo>(sources);
}

}  // namespace fbf
