// The installed user applications, as the whitelist and the assistant app list
// see them, and the asynchronous query of applications the voice assistant
// may use.
//
// On Linux both come from XDG desktop entries (see desktop_entries.h); tests
// substitute their own lists.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace fbf {

struct InstalledApplication {
  // The desktop file ID without ".desktop"; empty when the entry has none.
  std::string bundleIdentifier;
  // Applications without a version are not counted.
  std::optional<std::string> bundleVersion;
  // Entitled to the voice assistant, with an intents extension.
  bool providesIntents = false;
};

// Enumerates the installed applications. Thread-safety: callable from any
// thread; every call looks at the current state afresh.
class ApplicationRegistry {
 public:
  virtual ~ApplicationRegistry() = default;
  virtual std::vector<InstalledApplication> installedApplications() const = 0;
};

// Asks, asynchronously, for the applications entitled to the voice assistant
// that carry an intents extension. `reply` runs once, on some other thread,
// with one element per application (no value where an application has no
// bundle identifier); it may never run at all.
class AssistantAppRegistry {
 public:
  virtual ~AssistantAppRegistry() = default;
  using Reply = std::function<void(std::vector<std::optional<std::string>> bundleIdentifiers)>;
  virtual void queryEntitledApplications(Reply reply) = 0;
};

}  // namespace fbf
