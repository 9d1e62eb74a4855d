// File-system access for everything the daemon reads, writes and walks.
//
// Nothing here follows a symbolic link: attributes come from lstat/statx with
// AT_SYMLINK_NOFOLLOW, files are opened with O_NOFOLLOW, and `openForReading`
// refuses anything that is not a regular file owned by this user. Every file
// and directory created is owner-only (0600 / 0700). Failures are reported as
// "no value" / false with the errno in `error`; nothing throws.
// Thread-safety: stateless, callable from any thread.
#pragma once

#include "platform/clock.h"
#include "platform/xdg.h"

#include <sys/types.h>

#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <system_error>

namespace fbf {

namespace fs = std::filesystem;

enum class FileKind { regular, directory, symlink, other };

struct FileAttributes {
  FileKind kind = FileKind::other;
  uint64_t size = 0;
  // Birth time where the file system records it, else the modification time.
  SystemTime creationDate;
  // False when `creationDate` is only the modification time standing in.
  bool creationDateIsBirthTime = false;
  SystemTime modificationDate;
  uid_t owner = 0;
  mode_t mode = 0;

  bool isRegular() const { return kind == FileKind::regular; }
  bool isDirectory() const { return kind == FileKind::directory; }
};

struct DirectoryEntry {
  std::string name;
  fs::path path;
  FileAttributes attributes;  // read with the entry, without following links
};

// Streams the entries of one directory (not recursive, no "." or "..").
// Entries that vanish between listing and lstat are skipped.
class DirectoryEnumerator {
 public:
  virtual ~DirectoryEnumerator() = default;
  virtual std::optional<DirectoryEntry> next() = 0;
};

// An owned file descriptor.
class FileDescriptor {
 public:
  FileDescriptor() = default;
  explicit FileDescriptor(int fd) : fd_(fd) {}
  FileDescriptor(FileDescriptor&& o) noexcept : fd_(o.release()) {}
  FileDescriptor& operator=(FileDescriptor&& o) noexcept;
  FileDescriptor(const FileDescriptor&) = delete;
  FileDescriptor& operator=(const FileDescriptor&) = delete;
  ~FileDescriptor();
  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  int release() {
    int f = fd_;
    fd_ = -1;
    return f;
  }
  void reset();

 private:
  int fd_ = -1;
};

class FileManager {
 public:
  virtual ~FileManager() = default;

  // The user's caches directory, looked up without creating it.
  virtual std::optional<fs::path> cachesDirectory() const = 0;

  virtual std::optional<FileAttributes> attributes(const fs::path& path, std::error_code* error = nullptr) const = 0;
  bool exists(const fs::path& path) const { return attributes(path).has_value(); }

  // Null when the directory cannot be opened (missing, not a directory, a link).
  virtual std::unique_ptr<DirectoryEnumerator> enumerate(const fs::path& dir) const = 0;

  // rename(2): never follows links, fails across file systems.
  virtual bool moveItem(const fs::path& from, const fs::path& to, std::error_code& error) = 0;
  // Removes a file or link (the link itself), or an empty directory.
  virtual bool removeItem(const fs::path& path, std::error_code& error) = 0;
  virtual bool copyItem(const fs::path& from, const fs::path& to, std::error_code& error) = 0;

  // Creates the directory and missing parents with mode 0700, or repairs the
  // mode of an existing one. Fails when the path is a link or not a directory.
  virtual bool createOrFixDirectory(const fs::path& dir, std::error_code& error) = 0;

  // A regular file owned by this user, opened read-only without following links.
  virtual FileDescriptor openForReading(const fs::path& path, std::error_code& error) const = 0;
  // Creates (or truncates) a regular file with mode 0600 for writing.
  virtual FileDescriptor createForWriting(const fs::path& path, std::error_code& error) = 0;
  // A regular file with mode 0600 and no name yet, in `dir` (which must not
  // be a link), for writing. It vanishes with its last descriptor unless
  // `publish` names it first, so a crash leaves nothing half-written behind.
  // Invalid where the file system cannot make one.
  virtual FileDescriptor createUnnamedForWriting(const fs::path& dir, std::error_code& error) = 0;
  // Gives an unnamed file (open as `fd`) the name `path`; fails with
  // file_exists when the name is taken.
  virtual bool publish(int fd, const fs::path& path, std::error_code& error) = 0;

  virtual std::optional<std::string> readFile(const fs::path& path, std::error_code& error) const = 0;
  // Writes through a temporary file in the same directory and renames it over.
  virtual bool writeFileAtomically(const fs::path& path, std::string_view bytes, std::error_code& error) = 0;

  // Owner-only permissions; where a platform has data-protection classes this
  // is where the class would be set.
  virtual bool setOwnerOnlyProtection(const fs::path& path, std::error_code& error) = 0;

  // Makes everything written to the file system that holds `path` durable
  // (syncfs). One call covers any number of files, so callers batch it.
  virtual bool syncFileSystem(const fs::path& path, std::error_code& error) {
    (void)path;
    error = std::make_error_code(std::errc::function_not_supported);
    return false;
  }

  // Sets the modification date of the file or link itself (never its target).
  // Implementations that cannot do this report "function not supported".
  virtual bool setModificationDate(const fs::path& path, SystemTime date, std::error_code& error) {
    (void)path;
    (void)date;
    error = std::make_error_code(std::errc::function_not_supported);
    return false;
  }
};

// The real file system; the caches directory comes from `dirs.cacheHome`.
std::unique_ptr<FileManager> makePosixFileManager(XdgDirectories dirs);

// Attributes of an open descriptor (fstat/statx).
std::optional<FileAttributes> attributesOfDescriptor(int fd);

}  // namespace fbf
