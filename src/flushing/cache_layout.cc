#include "flushing/cache_layout.h"

#include "assembly/fbf_strings.h"
#include "assembly/feedback_types.h"
#include "platform/logging.h"

#include <unistd.h>

#include <algorithm>
#include <chrono>

namespace fbf {
namespace {

spdlog::logger& log() { return logging::get("SessionFilename"); }

bool isOwnedRegularFile(const FileAttributes& a) { return a.isRegular() && a.owner == geteuid(); }

struct DatedPath {
  SystemTime creationDate;
  fs::path path;
  bool operator<(const DatedPath& o) const {
    if (creationDate != o.creationDate) return creationDate < o.creationDate;
    return path < o.path;
  }
};

// One plain path component: not empty, no separator, not "." or "..", no NUL.
bool isPlainFileName(std::string_view name) {
  return !name.empty() && name != "." && name != ".." && name.find('/') == std::string_view::npos &&
         name.find('\0') == std::string_view::npos;
}

}  // namespace

SessionFileEnumerator::SessionFileEnumerator(std::unique_ptr<DirectoryEnumerator> entries)
    : entries_(std::move(entries)) {}

std::optional<DirectoryEntry> SessionFileEnumerator::next() {
  while (entries_) {
    auto entry = entries_->next();
    if (!entry) {
      entries_.reset();
      break;
    }
    if (!entry->name.starts_with(kVireonSessionFileNamePrefix)) continue;
    if (!isOwnedRegularFile(entry->attributes)) {
      log().info("Ignoring {}: not a regular file owned by this user.", entry->path.string());
      continue;
    }
    return entry;
  }
  return std::nullopt;
}

std::optional<SessionFileEnumerator> sessionFiles(const FileManager& fm) {
  auto dir = cacheDirNoCreate(fm);
  if (!dir) return std::nullopt;
  auto entries = fm.enumerate(*dir);
  if (!entries) return std::nullopt;
  return SessionFileEnumerator(std::move(entries));
}

void createRequiredCacheSubdirectories(FileManager& fm) {
  auto dir = cacheDirNoCreate(fm);
  if (!dir) {
    log().error("unable to obtain cache directory");
    return;
  }
  for (std::string_view name : {FBFStrings::CustomFeedbackDirectory, FBFStrings::CohortsModel}) {
    fs::path sub = *dir / name;
    std::error_code error;
    if (!fm.createOrFixDirectory(sub, error)) {
      log().error("Error making vireond caches subdir: {}", error.message());
      continue;
    }
    if (!fm.setOwnerOnlyProtection(sub, error)) {
      log().error("error setting protection key: {}", error.message());
    }
  }
}

std::optional<fs::path> vireon_renameForStateChange(FileManager& fm, const fs::path& sessionFile,
                                                    SessionFileState newState,
                                                    std::error_code& error) {
  auto name = SessionFilename::fromString(sessionFile.filename().native());
  if (!name) {
    error = std::make_error_code(std::errc::invalid_argument);
    return std::nullopt;
  }
  auto attrs = fm.attributes(sessionFile, &error);
  if (!attrs) return std::nullopt;
  if (!attrs->isRegular()) {
    // rename(2) would move a link itself, but a link must never enter the
    // life cycle: its target could be any file of the user.
    error = std::make_error_code(std::errc::operation_not_permitted);
    return std::nullopt;
  }
  name->state = newState;
  name->uploadPending = false;
  fs::path target = sessionFile.parent_path() / name->filenameString();
  if (target == sessionFile) return target;
  if (fm.attributes(target)) {
    // Replacing it would silently drop another copy of the session.
    error = std::make_error_code(std::errc::file_exists);
    return std::nullopt;
  }
  if (!fm.moveItem(sessionFile, target, error)) return std::nullopt;
  return target;
}

void vireon_cleanup(FileManager& fm, SystemTime now) {
  log().debug("Cleaning up");
  auto files = sessionFiles(fm);
  if (!files) return;
  while (auto entry = files->next()) {
    const std::string& fileName = entry->name;
    auto name = SessionFilename::fromString(fileName);
    if (!name) {
      log().warn("Unable to parse filename {} into a SessionFilename object.", fileName);
      std::error_code error;
      if (!fm.removeItem(entry->path, error)) log().error("error removing session file");
      continue;
    }
    switch (name->state) {
      case SessionFileState::closed:
        log().debug("Closed session file is ready for processing: {}.", fileName);
        break;
      case SessionFileState::uploaded:
        log().debug("Ignoring file in uploaded state, but you might want to delete it: {}.",
                    fileName);
        break;
      case SessionFileState::open: {
        auto age =
            std::chrono::duration_cast<std::chrono::seconds>(now - entry->attributes.creationDate)
                .count();
        // A negative age (creation date in the future) also leaves the file open.
        if (age <= FBFConstants::OrphanedOpenFileAgeSeconds) {
          log().debug("Leaving open session file {}.", fileName);
          break;
        }
        log().debug("Moving possible orphaned open session file to closed: {}.", fileName);
        std::error_code error;
        if (!vireon_renameForStateChange(fm, entry->path, SessionFileState::closed, error)) {
          log().error("error renaming session file {}", error.message());
        }
        break;
      }
      case SessionFileState::processing:
        break;
    }
  }
}

std::vector<fs::path> vireon_getPrunedSessionFiles(const FileManager& fm, int maximum,
                                                   const SessionFileExemption& exempt) {
  std::vector<DatedPath> files;
  if (auto list = sessionFiles(fm)) {
    while (auto entry = list->next()) {
      if (exempt && exempt(entry->path)) continue;
      files.push_back({entry->attributes.creationDate, std::move(entry->path)});
    }
  }
  size_t limit = static_cast<size_t>(std::max(maximum, 0));
  if (files.size() <= limit) return {};
  size_t prune = files.size() - limit / 2;
  std::partial_sort(files.begin(), files.begin() + static_cast<ptrdiff_t>(prune), files.end());
  std::vector<fs::path> result;
  result.reserve(prune);
  for (size_t i = 0; i < prune; ++i) result.push_back(std::move(files[i].path));
  return result;
}

size_t vireon_pruneSessionFiles(FileManager& fm, int maximum,
                                const SessionFileRemovalObserver& willRemove,
                                const SessionFileExemption& exempt) {
  size_t removed = 0;
  for (const auto& path : vireon_getPrunedSessionFiles(fm, maximum, exempt)) {
    if (willRemove) willRemove(path);
    std::error_code error;
    if (fm.removeItem(path, error)) {
      ++removed;
    } else {
      log().error("error removing session file");
    }
  }
  return removed;
}

bool vireon_removeItemOrLogError(FileManager& fm, const fs::path& path, std::string_view message) {
  std::error_code error;
  if (fm.removeItem(path, error)) return true;
  log().error("{}: {}", message, error.message());
  return false;
}

std::optional<fs::path> persistCustomFeedback(FileManager& fm, std::string_view bytes, int typeCode,
                                              std::string_view fileName) {
  auto root = customFeedbackDir(fm);
  std::string typeName = knownFeedbackTypeName(typeCode);
  fs::path dir = root ? (*root / typeName).lexically_normal() : fs::path(typeName);
  auto fail = [&](std::string_view why) -> std::optional<fs::path> {
    log().error("error persisting custom feedback at {}/{}", dir.string(), fileName);
    log().debug("Custom feedback not persisted: {}", why);
    return std::nullopt;
  };
  if (!root) return fail("no cache directory");
  const auto& known = allCustomFeedbackDirectories();
  if (std::find(known.begin(), known.end(), typeName) == known.end())
    return fail("not a custom feedback type");
  if (!isPlainFileName(fileName)) return fail("the file name is not a plain name");
  std::error_code error;
  if (!fm.createOrFixDirectory(dir, error)) return fail(error.message());
  fs::path file = dir / fileName;
  if (!fm.writeFileAtomically(file, bytes, error)) return fail(error.message());
  return file;
}

std::vector<DirectoryEntry> sessionFilesAwaitingUpload(const FileManager& fm) {
  std::vector<DirectoryEntry> result;
  if (auto list = sessionFiles(fm)) {
    while (auto entry = list->next()) {
      auto name = SessionFilename::fromString(entry->name);
      if (name && name->uploadPending) result.push_back(std::move(*entry));
    }
  }
  std::sort(result.begin(), result.end(), [](const DirectoryEntry& a, const DirectoryEntry& b) {
    if (a.attributes.creationDate != b.attributes.creationDate)
      return a.attributes.creationDate < b.attributes.creationDate;
    return a.name < b.name;
  });
  return result;
}

}  // namespace fbf
