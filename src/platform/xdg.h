// The XDG base directories the daemon and its tools work in.
//
// Read once from the environment by the composition root and handed to the
// platform services; tests build one pointing at a temporary directory.
#pragma once

#include <filesystem>
#include <vector>

namespace fbf {

struct XdgDirectories {
  std::filesystem::path cacheHome;    // $XDG_CACHE_HOME or ~/.cache
  std::filesystem::path configHome;   // $XDG_CONFIG_HOME or ~/.config
  std::filesystem::path stateHome;    // $XDG_STATE_HOME or ~/.local/state
  std::filesystem::path dataHome;     // $XDG_DATA_HOME or ~/.local/share
  std::filesystem::path runtimeDir;   // $XDG_RUNTIME_DIR, else a private directory under /tmp
  std::vector<std::filesystem::path> dataDirs;  // $XDG_DATA_DIRS or /usr/local/share:/usr/share

  static XdgDirectories fromEnvironment();
  // Everything under one root, as tests and the demo lay it out.
  static XdgDirectories underRoot(const std::filesystem::path& root);

  std::filesystem::path preferencesDir() const { return configHome / "preferences"; }
  std::filesystem::path socketPath() const { return runtimeDir / "vireon-fbf.sock"; }
  std::filesystem::path analyticsFile() const { return stateHome / "vireon-fbf" / "analytics.jsonl"; }
};

}  // namespace fbf
