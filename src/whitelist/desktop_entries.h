// Installed applications from XDG desktop entries.
//
// The application directories are $XDG_DATA_HOME/applications, then
// <dir>/applications for each directory of $XDG_DATA_DIRS, in that order.
// A ".desktop" file found at <appdir>/vendor/tool.desktop has the desktop
// file ID "vendor-tool.desktop" and the bundle identifier "vendor-tool". The
// first file with a given ID decides (earlier directories shadow later ones,
// even when the earlier file hides the entry or cannot be read). An entry is
// an application when its "Desktop Entry" group says Type=Application and not
// Hidden=true; it provides intents to the voice assistant when its Implements
// list names "vireon.Intents". Files are parsed with GLib's GKeyFile.
//
// Thread-safety: the registry holds only its directory list; every call walks
// the directories afresh and may run on any thread.
#pragma once

#include "platform/xdg.h"
#include "whitelist/application_registry.h"

#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace fbf {

// What the whitelist needs from one desktop entry file.
struct DesktopEntry {
  bool isApplication = false;  // Type=Application
  bool hidden = false;         // Hidden=true
  std::vector<std::string> implements;
};

// Parses the contents of a desktop entry file. No value, with `error` set,
// when the text is not a key file or has no "Desktop Entry" group.
std::optional<DesktopEntry> parseDesktopEntry(std::string_view contents,
                                              std::string* error = nullptr);

// "vendor/tool.desktop" (relative to its applications directory) becomes
// "vendor-tool.desktop".
std::string desktopFileId(const std::filesystem::path& relativePath);

// The application directories in lookup order.
std::vector<std::filesystem::path> applicationDirectories(const XdgDirectories& dirs);

class DesktopEntryRegistry final : public ApplicationRegistry {
 public:
  explicit DesktopEntryRegistry(std::vector<std::filesystem::path> applicationDirectories)
      : directories_(std::move(applicationDirectories)) {}
  std::vector<InstalledApplication> installedApplications() const override;

 private:
  std::vector<std::filesystem::path> directories_;
};

// Answers the assistant query from `registry` on a worker thread of its own.
std::shared_ptr<AssistantAppRegistry> makeDesktopEntryAssistantRegistry(
    std::shared_ptr<const ApplicationRegistry> registry);

}  // namespace fbf
