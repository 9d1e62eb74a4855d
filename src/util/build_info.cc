#include "util/build_info.h"

#include <mutex>

namespace fbf {
namespace {

std::mutex gMutex;
BuildInfoSource gSource;

}  // namespace

void installBuildInfoSource(BuildInfoSource source) {
  std::lock_guard lock(gMutex);
  gSource = std::move(source);
}

std::string buildVersion() {
  static const std::string cached = [] {
    std::lock_guard lock(gMutex);
    return gSource.buildVersion ? gSource.buildVersion() : std::string();
  }();
  return cached;
}

}  // namespace fbf

extern "C" {

bool vireon_isInternalBuild(void) {
  static const bool cached = [] {
    std::lock_guard lock(fbf::gMutex);
    return fbf::gSource.isInternalBuild ? fbf::gSource.isInternalBuild() : false;
  }();
  return cached;
}

bool vireon_isSeedBuild(void) { return true; }

}  // extern "C"
