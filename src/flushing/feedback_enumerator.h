// The files one flush works through: session files directly in the cache
// directory and custom feedback files in the per-type subdirectories of
// "CustomFeedback".
//
// `FeedbackEnumerator` keeps one open directory per directory still being
// walked and, on every call, picks one of them uniformly at random, so that
// session and custom feedback files are interleaved; within a directory the
// order is the directory's own. Subdirectories are never descended into
// (each custom feedback directory has its own walk), so a file is yielded at
// most once. Only regular files owned by this user are yielded; links,
// FIFOs, sockets and foreign files are skipped with a log line and never
// followed; directories are passed over silently. Memory stays constant
// whatever the number of files.
//
// Owned by the flusher that made it and used on the work queue only.
#pragma once

#include "assembly/fbf_assembly_protocol.h"
#include "flushing/session_filename.h"
#include "platform/file_manager.h"

#include <cstddef>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace fbf {

enum class FeedbackFileType { unknown = 0, session = 1, custom = 2 };

struct FeedbackFile {
  // Classifies by name: a parseable session name is a session file; else a
  // file whose directory is one of the custom feedback directories is custom;
  // anything else is unknown.
  explicit FeedbackFile(fs::path fileURL, std::optional<FileAttributes> attributes = std::nullopt);

  fs::path fileURL;
  FeedbackFileType fileType = FeedbackFileType::unknown;
  std::optional<SessionFilename> sessionFilename;
  // As read with the directory entry (size, creation date, kind), without
  // following links; absent for a file made from a bare path.
  std::optional<FileAttributes> attributes;

  std::string fileName() const;
  // The name of the directory that holds the file.
  std::string enclosingDirectory() const;
  // The path ends with ".uploadPending".
  bool uploadPending() const;
  // "FeedbackV2"/"FeedbackV2PB" for a session file (its upload format), the
  // directory name for a custom file, "" for an unknown one.
  std::string typeString() const;
  // The known feedback type code of `typeString()`, 0 when it has none.
  int knownFeedbackType() const;
};

// Picks an index uniformly in [0, count); count is at least 1.
using RandomChoice = std::function<size_t(size_t count)>;
// Draws from std::random_device on every call.
RandomChoice systemRandomChoice();

class FeedbackEnumerator {
 public:
  // No value when the cache directory or the custom feedback directory cannot
  // be located. An empty `typeFilter` walks the cache directory and every
  // custom feedback directory; a non-empty one walks only the custom feedback
  // directories it names and leaves session files out. Directories that do
  // not exist are simply not walked.
  static std::optional<FeedbackEnumerator> make(FBFAssemblyProtocol& assembly,
                                                std::vector<std::string> typeFilter = {},
                                                RandomChoice choose = systemRandomChoice());
  static std::optional<FeedbackEnumerator> make(const FileManager& fm,
                                                std::vector<std::string> typeFilter = {},
                                                RandomChoice choose = systemRandomChoice());

  FeedbackEnumerator(FeedbackEnumerator&&) noexcept = default;
  FeedbackEnumerator& operator=(FeedbackEnumerator&&) noexcept = default;

  // The next session or custom feedback file; no value once every directory
  // is exhausted, and on every call after that.
  std::optional<FeedbackFile> next();
  // Drops the remaining walks so that `next()` yields nothing more.
  void finish() { walks_.clear(); }

  const std::vector<std::string>& typeFilter() const { return typeFilter_; }
  // Directories still being walked.
  size_t pendingDirectoryCount() const { return walks_.size(); }

 private:
  FeedbackEnumerator(std::vector<std::string> typeFilter, RandomChoice choose)
      : typeFilter_(std::move(typeFilter)), choose_(std::move(choose)) {}
  std::optional<DirectoryEntry> nextEntry();

  std::vector<std::unique_ptr<DirectoryEnumerator>> walks_;
  std::vector<std::string> typeFilter_;
  RandomChoice choose_;
};

}  // namespace fbf
