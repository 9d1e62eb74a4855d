#include "platform/xdg.h"

#include <pwd.h>
#include <unistd.h>

#include <cstdlib>
#include <sstream>
#include <string>

namespace fbf {
namespace {

std::filesystem::path homeDir() {
  if (const char* h = std::getenv("HOME"); h && *h) return h;
  if (const passwd* pw = getpwuid(getuid()); pw && pw->pw_dir) return pw->pw_dir;
  return "/";
}

// The base-directory rules ignore relative paths.
std::filesystem::path envDir(const char* name, const std::filesystem::path& fallback) {
  const char* v = std::getenv(name);
  if (v && *v == '/') return v;
  return fallback;
}

}  // namespace

XdgDirectories XdgDirectories::fromEnvironment() {
  XdgDirectories d;
  auto home = homeDir();
  d.cacheHome = envDir("XDG_CACHE_HOME", home / ".cache");
  d.configHome = envDir("XDG_CONFIG_HOME", home / ".config");
  d.stateHome = envDir("XDG_STATE_HOME", home / ".local" / "state");
  d.dataHome = envDir("XDG_DATA_HOME", home / ".local" / "share");
  d.runtimeDir = envDir("XDG_RUNTIME_DIR", std::filesystem::path("/tmp") / ("vireon-fbf-" + std::to_string(getuid())));
  std::string dirs = "/usr/local/share:/usr/share";
  if (const char* v = std::getenv("XDG_DATA_DIRS"); v && *v) dirs = v;
  std::stringstream ss(dirs);
  std::string item;
  while (std::getline(ss, item, ':')) {
    if (!item.empty() && item[0] == '/') d.dataDirs.emplace_back(item);
  }
  return d;
}

XdgDirectories XdgDirectories::underRoot(const std::filesystem::path& root) {
  XdgDirectories d;
  d.cacheHome = root / "cache";
  d.configHome = root / "config";
  d.stateHome = root / "state";
  d.dataHome = root / "data";
  d.runtimeDir = root / "run";
  d.dataDirs = {root / "share"};
  return d;
}

}  // namespace fbf
