#include "flushing/feedback_enumerator.h"

#include "assembly/cache_paths.h"
#include "assembly/fbf_strings.h"
#include "assembly/feedback_types.h"
#include "platform/logging.h"

#include <unistd.h>

#include <algorithm>
#include <random>

namespace fbf {
namespace {

spdlog::logger& log() { return logging::get("FeedbackEnumerator"); }

bool isCustomFeedbackDirectory(const std::string& name) {
  const auto& dirs = allCustomFeedbackDirectories();
  return std::find(dirs.begin(), dirs.end(), name) != dirs.end();
}

}  // namespace

FeedbackFile::FeedbackFile(fs::path url, std::optional<FileAttributes> attrs)
    : fileURL(std::move(url)), attributes(std::move(attrs)) {
  sessionFilename = SessionFilename::fromString(fileURL.filename().native());
  if (sessionFilename) {
    fileType = FeedbackFileType::session;
  } else if (isCustomFeedbackDirectory(enclosingDirectory())) {
    fileType = FeedbackFileType::custom;
  }
}

std::string FeedbackFile::fileName() const { return fileURL.filename().string(); }

std::string FeedbackFile::enclosingDirectory() const {
  return fileURL.parent_path().filename().string();
}

bool FeedbackFile::uploadPending() const {
  return fileURL.native().ends_with(FBFStrings::UploadPendingSuffix);
}

std::string FeedbackFile::typeString() const {
  switch (fileType) {
    case FeedbackFileType::session:
      return std::string(queryParameterString(sessionFilename->uploadFormat));
    case FeedbackFileType::custom:
      return enclosingDirectory();
    case FeedbackFileType::unknown:
      break;
  }
  return {};
}

int FeedbackFile::knownFeedbackType() const {
  return knownFeedbackTypeFromName(typeString()).value_or(kKnownFeedbackTypeUnknown);
}

RandomChoice systemRandomChoice() {
  auto device = std::make_shared<std::random_device>();
  return [device](size_t count) {
    std::uniform_int_distribution<size_t> pick(0, count - 1);
    return pick(*device);
  };
}

std::optional<FeedbackEnumerator> FeedbackEnumerator::make(FBFAssemblyProtocol& assembly,
                                                           std::vector<std::string> typeFilter,
                                                           RandomChoice choose) {
  return make(assembly.fileManager(), std::move(typeFilter), std::move(choose));
}

std::optional<FeedbackEnumerator> FeedbackEnumerator::make(const FileManager& fm,
                                                           std::vector<std::string> typeFilter,
                                                           RandomChoice choose) {
  auto cacheDir = cacheDirNoCreate(fm);
  auto customDir = customFeedbackDir(fm);
  if (!cacheDir || !customDir) return std::nullopt;

  FeedbackEnumerator result(std::move(typeFilter), std::move(choose));
  auto add = [&](const fs::path& dir) {
    if (auto walk = fm.enumerate(dir)) {
      result.walks_.push_back(std::move(walk));
      return;
    }
    // A missing directory is normal; anything else in its place is not ours
    // to read, and someone should know why its files are not sent.
    auto attrs = fm.attributes(dir);
    if (!attrs) return;
    if (attrs->kind == FileKind::symlink) {
      log().warn("Skipping {}: it is a symbolic link, which is never followed.", dir.string());
    } else if (!attrs->isDirectory() || attrs->owner != geteuid()) {
      log().warn("Skipping {}: not a directory owned by this user.", dir.string());
    } else {
      log().warn("Skipping {}: it cannot be opened.", dir.string());
    }
  };
  const auto& filter = result.typeFilter_;
  if (filter.empty()) add(*cacheDir);
  for (const auto& type : allCustomFeedbackDirectories()) {
    if (filter.empty() || std::find(filter.begin(), filter.end(), type) != filter.end())
      add(*customDir / type);
  }
  return result;
}

std::optional<DirectoryEntry> FeedbackEnumerator::nextEntry() {
  while (!walks_.empty()) {
    size_t index = walks_.size() == 1 ? 0 : choose_(walks_.size());
    if (index >= walks_.size()) index = walks_.size() - 1;
    auto& walk = walks_[index];
    std::optional<DirectoryEntry> entry;
    // A directory removed mid-walk simply ends its walk.
    while ((entry = walk->next()) && entry->attributes.isDirectory()) {
    }
    if (entry) return entry;
    walks_.erase(walks_.begin() + static_cast<ptrdiff_t>(index));
  }
  return std::nullopt;
}

std::optional<FeedbackFile> FeedbackEnumerator::next() {
  while (auto entry = nextEntry()) {
    const auto& attrs = entry->attributes;
    if (!attrs.isRegular() || attrs.owner != geteuid()) {
      log().info("Feedback enumerator skipped {}", entry->path.string());
      continue;
    }
    // Hidden files are partial uploads being written, never feedback.
    if (entry->name.starts_with(".")) continue;
    FeedbackFile file(std::move(entry->path), attrs);
    if (file.fileType == FeedbackFileType::unknown) {
      log().debug("Feedback enumerator skipped {}", file.fileURL.string());
      continue;
    }
    log().debug("Feedback enumerator found {}", file.fileURL.string());
    return file;
  }
  return std::nullopt;
}

}  // namespace fbf
