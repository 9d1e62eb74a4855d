// Build facts shared with the rest of the search service.
//
// `vireon_isInternalBuild` and `buildVersion` ask their source once and keep
// the answer for the life of the process. The composition root installs the
// source before the first call; with none installed they answer false / "".
#pragma once

#include <functional>
#include <string>

extern "C" {
bool vireon_isInternalBuild(void);
// Constant yes in this build: uploads always carry the seed marker.
bool vireon_isSeedBuild(void);
}

namespace fbf {

struct BuildInfoSource {
  std::function<bool()> isInternalBuild;
  std::function<std::string()> buildVersion;
};

void installBuildInfoSource(BuildInfoSource source);
std::string buildVersion();

// The shared framework's daemon name-and-version (the last User-Agent part).
inline constexpr const char* kDaemonNameAndVersion = "vireon-fbf/" FBF_VERSION_STRING;

}  // namespace fbf
