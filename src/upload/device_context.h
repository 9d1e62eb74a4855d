// Device and locale facts for upload requests, and the User-Agent.
//
// The four facts are read once at construction; the device string is built
// once. Immutable afterwards, so safe to read from any thread.
#pragma once

#include "assembly/fbf_assembly_protocol.h"
#include "platform/device_info.h"

namespace fbf {

class DeviceContext final : public DeviceContextProtocol {
 public:
  // `daemonNameAndVersion` is the last part of the User-Agent; an empty one
  // is a broken build and stops the process when the User-Agent is asked for.
  DeviceContext(const DeviceInfo& info, std::string daemonNameAndVersion);

  std::optional<std::string> localeIdentifier() const override { return locale_; }
  std::optional<std::string> country() const override { return country_; }
  std::optional<std::string> deviceModel() const override { return model_; }
  std::optional<std::string> osVersion() const override { return osVersion_; }
  std::string userAgent() const override;

  // "<ProductType>; <ProductName> <ProductVersion> <BuildVersion>".
  const std::string& deviceString() const { return deviceString_; }

 private:
  std::optional<std::string> locale_, country_, model_, osVersion_;
  std::string deviceString_;
  std::string daemonNameAndVersion_;
};

}  // namespace fbf
