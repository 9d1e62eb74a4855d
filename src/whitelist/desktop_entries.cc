#include "whitelist/desktop_entries.h"

#include "platform/logging.h"

#include <glib.h>

#include <algorithm>
#include <cctype>
#include <fstream>
#include <map>
#include <set>
#include <thread>

namespace fbf {
namespace {

namespace fs = std::filesystem;

spdlog::logger& registryLog() { return logging::get("ApplicationRegistry"); }

constexpr const char* kDesktopEntryGroup = "Desktop Entry";
constexpr std::string_view kDesktopSuffix = ".desktop";
constexpr std::string_view kIntentsInterface = "vireon.Intents";
// Desktop entries are a few KiB; anything far larger is not one.
constexpr std::uintmax_t kMaximumEntrySize = 1 << 20;
// Deep trees under an applications directory are not desktop-entry layouts.
constexpr int kMaximumDepth = 8;

struct KeyFileDeleter {
  void operator()(GKeyFile* f) const { g_key_file_free(f); }
};
struct GErrorDeleter {
  void operator()(GError* e) const { g_error_free(e); }
};

std::string trim(std::string s) {
  auto notSpace = [](unsigned char c) { return !std::isspace(c); };
  s.erase(s.begin(), std::find_if(s.begin(), s.end(), notSpace));
  s.erase(std::find_if(s.rbegin(), s.rend(), notSpace).base(), s.end());
  return s;
}

bool endsWith(std::string_view s, std::string_view suffix) {
  return s.size() >= suffix.size() && s.substr(s.size() - suffix.size()) == suffix;
}

std::optional<std::string> readSmallFile(const fs::path& path, std::string* error) {
  std::error_code ec;
  auto size = fs::file_size(path, ec);
  if (ec) {
    *error = ec.message();
    return std::nullopt;
  }
  if (size > kMaximumEntrySize) {
    *error = "file too large";
    return std::nullopt;
  }
  std::ifstream in(path, std::ios::binary);
  if (!in) {
    *error = "cannot open";
    return std::nullopt;
  }
  std::string contents(static_cast<size_t>(size), '\0');
  in.read(contents.data(), static_cast<std::streamsize>(size));
  contents.resize(static_cast<size_t>(in.gcount()));
  return contents;
}

// The ".desktop" files under one applications directory, by path relative
// to it, in name order so that duplicate IDs within a directory resolve the
// same way every time. Linked files are read; linked directories are not
// entered, so a link cycle cannot trap the walk.
std::vector<fs::path> desktopFilesUnder(const fs::path& dir) {
  std::vector<fs::path> found;
  std::error_code ec;
  fs::recursive_directory_iterator it(dir, fs::directory_options::skip_permission_denied, ec);
  if (ec) return found;
  for (auto end = fs::recursive_directory_iterator(); it != end; it.increment(ec)) {
    if (ec) break;
    if (it.depth() >= kMaximumDepth) it.disable_recursion_pending();
    const auto& entry = *it;
    std::error_code typeError;
    if (!entry.is_regular_file(typeError)) continue;
    if (!endsWith(entry.path().filename().string(), kDesktopSuffix)) continue;
    found.push_back(entry.path().lexically_relative(dir));
  }
  std::sort(found.begin(), found.end());
  return found;
}

}  // namespace

std::optional<DesktopEntry> parseDesktopEntry(std::string_view contents, std::string* error) {
  std::unique_ptr<GKeyFile, KeyFileDeleter> file(g_key_file_new());
  GError* rawError = nullptr;
  if (!g_key_file_load_from_data(file.get(), contents.data(), contents.size(), G_KEY_FILE_NONE,
                                 &rawError)) {
    std::unique_ptr<GError, GErrorDeleter> owned(rawError);
    if (error) *error = owned ? owned->message : "unreadable key file";
    return std::nullopt;
  }
  if (!g_key_file_has_group(file.get(), kDesktopEntryGroup)) {
    if (error) *error = "no [Desktop Entry] group";
    return std::nullopt;
  }

  DesktopEntry entry;
  // Plain (unlocalised) values only: "Type[fr]" or "Hidden[de]" mean nothing.
  if (gchar* type = g_key_file_get_string(file.get(), kDesktopEntryGroup, "Type", nullptr)) {
    entry.isApplication = std::string_view(type) == "Application";
    g_free(type);
  }
  GError* boolError = nullptr;
  entry.hidden = g_key_file_get_boolean(file.get(), kDesktopEntryGroup, "Hidden", &boolError);
  if (boolError) {
    entry.hidden = false;
    g_error_free(boolError);
  }
  gsize count = 0;
  if (gchar** list = g_key_file_get_string_list(file.get(), kDesktopEntryGroup, "Implements",
                                                &count, nullptr)) {
    for (gsize i = 0; i < count; ++i) {
      std::string name = trim(list[i]);
      if (!name.empty()) entry.implements.push_back(std::move(name));
    }
    g_strfreev(list);
  }
  return entry;
}

std::string desktopFileId(const fs::path& relativePath) {
  std::string id;
  for (const auto& part : relativePath) {
    if (!id.empty()) id += '-';
    id += part.string();
  }
  return id;
}

std::vector<fs::path> applicationDirectories(const XdgDirectories& dirs) {
  std::vector<fs::path> result;
  result.push_back(dirs.dataHome / "applications");
  for (const auto& d : dirs.dataDirs) result.push_back(d / "applications");
  return result;
}

std::vector<InstalledApplication> DesktopEntryRegistry::installedApplications() const {
  std::set<std::string> seenIds;
  std::map<std::string, InstalledApplication> applications;
  for (const auto& dir : directories_) {
    for (const auto& relative : desktopFilesUnder(dir)) {
      std::string id = desktopFileId(relative);
      if (!seenIds.insert(id).second) continue;  // shadowed by an earlier directory or file
      std::string error;
      auto contents = readSmallFile(dir / relative, &error);
      std::optional<DesktopEntry> entry;
      if (contents) entry = parseDesktopEntry(*contents, &error);
      if (!entry) {
        registryLog().error("could not read desktop entry {}: {}", (dir / relative).string(),
                            error);
        continue;
      }
      if (!entry->isApplication || entry->hidden) continue;
      InstalledApplication app;
      app.bundleIdentifier = id.substr(0, id.size() - kDesktopSuffix.size());
      // Every valid entry counts as versioned.
      app.bundleVersion = "";
      app.providesIntents = std::find(entry->implements.begin(), entry->implements.end(),
                                      kIntentsInterface) != entry->implements.end();
      if (app.bundleIdentifier.empty()) continue;
      applications.emplace(app.bundleIdentifier, std::move(app));
    }
  }
  std::vector<InstalledApplication> result;
  result.reserve(applications.size());
  for (auto& [_, app] : applications) result.push_back(std::move(app));
  return result;
}

namespace {

class DesktopEntryAssistantRegistry final : public AssistantAppRegistry {
 public:
  explicit DesktopEntryAssistantRegistry(std::shared_ptr<const ApplicationRegistry> registry)
      : registry_(std::move(registry)) {}

  void queryEntitledApplications(Reply reply) override {
    // Detached: the asker may stop waiting; the thread owns what it uses.
    std::thread([registry = registry_, reply = std::move(reply)] {
      std::vector<std::optional<std::string>> identifiers;
      for (const auto& app : registry->installedApplications()) {
        if (!app.providesIntents) continue;
        if (app.bundleIdentifier.empty()) {
          identifiers.emplace_back(std::nullopt);
        } else {
          identifiers.emplace_back(app.bundleIdentifier);
        }
      }
      reply(std::move(identifiers));
    }).detach();
  }

 private:
  std::shared_ptr<const ApplicationRegistry> registry_;
};

}  // namespace

std::shared_ptr<AssistantAppRegistry> makeDesktopEntryAssistantRegistry(
    std::shared_ptr<const ApplicationRegistry> registry) {
  return std::make_shared<DesktopEntryAssistantRegistry>(std::move(registry));
}

}  // namespace fbf
