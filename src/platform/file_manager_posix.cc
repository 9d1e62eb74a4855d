#include "platform/file_manager.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <random>

namespace fbf {
namespace {

std::error_code lastError() { return {errno, std::generic_category()}; }

SystemTime fromTimestamp(const statx_timestamp& ts) {
  return SystemTime(std::chrono::seconds(ts.tv_sec) + std::chrono::nanoseconds(ts.tv_nsec));
}

FileKind kindOf(mode_t mode) {
  if (S_ISREG(mode)) return FileKind::regular;
  if (S_ISDIR(mode)) return FileKind::directory;
  if (S_ISLNK(mode)) return FileKind::symlink;
  return FileKind::other;
}

FileAttributes fromStatx(const struct statx& st) {
  FileAttributes a;
  a.kind = kindOf(st.stx_mode);
  a.size = st.stx_size;
  a.modificationDate = fromTimestamp(st.stx_mtime);
  a.creationDate = (st.stx_mask & STATX_BTIME) ? fromTimestamp(st.stx_btime) : a.modificationDate;
  a.creationDateIsBirthTime = (st.stx_mask & STATX_BTIME) != 0;
  a.owner = st.stx_uid;
  a.mode = st.stx_mode & 07777;
  return a;
}

std::optional<FileAttributes> statxAt(int dirfd, const char* path, int flags, std::error_code* error) {
  struct statx st {};
  unsigned mask = STATX_TYPE | STATX_MODE | STATX_SIZE | STATX_MTIME | STATX_BTIME | STATX_UID;
  if (statx(dirfd, path, flags | AT_SYMLINK_NOFOLLOW | AT_STATX_SYNC_AS_STAT, mask, &st) != 0) {
    if (error) *error = lastError();
    return std::nullopt;
  }
  return fromStatx(st);
}

class PosixDirectoryEnumerator final : public DirectoryEnumerator {
 public:
  PosixDirectoryEnumerator(DIR* dir, fs::path base) : dir_(dir), base_(std::move(base)) {}
  ~PosixDirectoryEnumerator() override { closedir(dir_); }

  std::optional<DirectoryEntry> next() override {
    while (true) {
      errno = 0;
      dirent* e = readdir(dir_);
      if (!e) return std::nullopt;
      if (std::strcmp(e->d_name, ".") == 0 || std::strcmp(e->d_name, "..") == 0) continue;
      auto attrs = statxAt(dirfd(dir_), e->d_name, 0, nullptr);
      if (!attrs) continue;  // removed since it was listed
      return DirectoryEntry{e->d_name, base_ / e->d_name, *attrs};
    }
  }

 private:
  DIR* dir_;
  fs::path base_;
};

class PosixFileManager final : public FileManager {
 public:
  explicit PosixFileManager(XdgDirectories dirs) : dirs_(std::move(dirs)) {}

  std::optional<fs::path> cachesDirectory() const override {
    auto a = attributes(dirs_.cacheHome, nullptr);
    if (!a || !a->isDirectory()) return std::nullopt;
    return dirs_.cacheHome;
  }

  std::optional<FileAttributes> attributes(const fs::path& path, std::error_code* error) const override {
    return statxAt(AT_FDCWD, path.c_str(), 0, error);
  }

  std::unique_ptr<DirectoryEnumerator> enumerate(const fs::path& dir) const override {
    int fd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) return nullptr;
    DIR* d = fdopendir(fd);
    if (!d) {
      close(fd);
      return nullptr;
    }
    return std::make_unique<PosixDirectoryEnumerator>(d, dir);
  }

  bool moveItem(const fs::path& from, const fs::path& to, std::error_code& error) override {
    if (rename(from.c_str(), to.c_str()) != 0) {
      error = lastError();
      return false;
    }
    return true;
  }

  bool removeItem(const fs::path& path, std::error_code& error) override {
    if (unlink(path.c_str()) == 0) return true;
    if (errno == EISDIR || errno == EPERM) {
      if (rmdir(path.c_str()) == 0) return true;
    }
    error = lastError();
    return false;
  }

  bool copyItem(const fs::path& from, const fs::path& to, std::error_code& error) override {
    FileDescriptor in = openForReading(from, error);
    if (!in.valid()) return false;
    FileDescriptor out = createForWriting(to, error);
    if (!out.valid()) return false;
    char buf[65536];
    while (true) {
      ssize_t n = read(in.get(), buf, sizeof buf);
      if (n < 0) {
        if (errno == EINTR) continue;
        error = lastError();
        return false;
      }
      if (n == 0) return true;
      if (!writeAll(out.get(), buf, static_cast<size_t>(n), error)) return false;
    }
  }

  bool createOrFixDirectory(const fs::path& dir, std::error_code& error) override {
    auto a = attributes(dir, nullptr);
    if (!a) {
      if (dir.has_parent_path() && dir.parent_path() != dir && !exists(dir.parent_path())) {
        if (!createOrFixDirectory(dir.parent_path(), error)) return false;
      }
      if (mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) {
        error = lastError();
        return false;
      }
      a = attributes(dir, &error);
      if (!a) return false;
    }
    if (!a->isDirectory()) {
      error = std::make_error_code(std::errc::not_a_directory);
      return false;
    }
    if (a->mode != 0700 && chmod(dir.c_str(), 0700) != 0) {
      error = lastError();
      return false;
    }
    return true;
  }

  FileDescriptor openForReading(const fs::path& path, std::error_code& error) const override {
    FileDescriptor fd(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK));
    if (!fd.valid()) {
      error = lastError();
      return {};
    }
    auto a = attributesOfDescriptor(fd.get());
    if (!a || !a->isRegular()) {
      error = std::make_error_code(std::errc::invalid_argument);
      return {};
    }
    if (a->owner != geteuid()) {
      error = std::make_error_code(std::errc::permission_denied);
      return {};
    }
    // O_NONBLOCK only guarded the open against FIFOs; regular reads ignore it.
    return fd;
  }

  bool syncFileSystem(const fs::path& path, std::error_code& error) override {
    FileDescriptor fd(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd.valid() || syncfs(fd.get()) != 0) {
      error = lastError();
      return false;
    }
    return true;
  }

  FileDescriptor createUnnamedForWriting(const fs::path& dir, std::error_code& error) override {
    FileDescriptor fd(open(dir.c_str(), O_TMPFILE | O_WRONLY | O_NOFOLLOW | O_CLOEXEC, 0600));
    if (!fd.valid()) error = lastError();
    return fd;
  }

  bool publish(int fd, const fs::path& path, std::error_code& error) override {
    // linkat(AT_EMPTY_PATH) needs CAP_DAC_READ_SEARCH; the descriptor's link
    // under /proc/self does not.
    const std::string link = "/proc/self/fd/" + std::to_string(fd);
    if (linkat(AT_FDCWD, link.c_str(), AT_FDCWD, path.c_str(), AT_SYMLINK_FOLLOW) != 0) {
      error = lastError();
      return false;
    }
    return true;
  }

  FileDescriptor createForWriting(const fs::path& path, std::error_code& error) override {
    FileDescriptor fd(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0600));
    if (!fd.valid()) {
      error = lastError();
      return {};
    }
    auto a = attributesOfDescriptor(fd.get());
    if (!a || !a->isRegular()) {
      error = std::make_error_code(std::errc::invalid_argument);
      return {};
    }
    if (a->mode != 0600) fchmod(fd.get(), 0600);
    return fd;
  }

  std::optional<std::string> readFile(const fs::path& path, std::error_code& error) const override {
    FileDescriptor fd = openForReading(path, error);
    if (!fd.valid()) return std::nullopt;
    std::string out;
    char buf[65536];
    while (true) {
      ssize_t n = read(fd.get(), buf, sizeof buf);
      if (n < 0) {
        if (errno == EINTR) continue;
        error = lastError();
        return std::nullopt;
      }
      if (n == 0) return out;
      out.append(buf, static_cast<size_t>(n));
    }
  }

  bool writeFileAtomically(const fs::path& path, std::string_view bytes, std::error_code& error) override {
    std::random_device rd;
    fs::path tmp = path;
    tmp += ".tmp." + std::to_string(rd());
    {
      FileDescriptor fd(open(tmp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
      if (!fd.valid()) {
        error = lastError();
        return false;
      }
      if (!writeAll(fd.get(), bytes.data(), bytes.size(), error) || fsync(fd.get()) != 0) {
        if (!error) error = lastError();
        unlink(tmp.c_str());
        return false;
      }
    }
    if (rename(tmp.c_str(), path.c_str()) != 0) {
      error = lastError();
      unlink(tmp.c_str());
      return false;
    }
    return true;
  }

  bool setOwnerOnlyProtection(const fs::path& path, std::error_code& error) override {
    auto a = attributes(path, &error);
    if (!a) return false;
    if (a->kind == FileKind::symlink) {
      error = std::make_error_code(std::errc::operation_not_permitted);
      return false;
    }
    mode_t want = a->isDirectory() ? 0700 : 0600;
    if (a->mode != want && fchmodat(AT_FDCWD, path.c_str(), want, 0) != 0) {
      error = lastError();
      return false;
    }
    return true;
  }

  bool setModificationDate(const fs::path& path, SystemTime date, std::error_code& error) override {
    auto since = date.time_since_epoch();
    auto seconds = std::chrono::floor<std::chrono::seconds>(since);
    struct timespec times[2];
    times[0].tv_sec = 0;
    times[0].tv_nsec = UTIME_OMIT;
    times[1].tv_sec = static_cast<time_t>(seconds.count());
    times[1].tv_nsec = static_cast<long>(std::chrono::duration_cast<std::chrono::nanoseconds>(since - seconds).count());
    if (utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW) != 0) {
      error = lastError();
      return false;
    }
    return true;
  }

 private:
  static bool writeAll(int fd, const char* data, size_t len, std::error_code& error) {
    while (len > 0) {
      ssize_t n = write(fd, data, len);
      if (n < 0) {
        if (errno == EINTR) continue;
        error = lastError();
        return false;
      }
      data += n;
      len -= static_cast<size_t>(n);
    }
    return true;
  }

  XdgDirectories dirs_;
};

}  // namespace

FileDescriptor& FileDescriptor::operator=(FileDescriptor&& o) noexcept {
  if (this != &o) {
    reset();
    fd_ = o.release();
  }
  return *this;
}
FileDescriptor::~FileDescriptor() { reset(); }
void FileDescriptor::reset() {
  if (fd_ >= 0) close(fd_);
  fd_ = -1;
}

std::optional<FileAttributes> attributesOfDescriptor(int fd) {
  return statxAt(fd, "", AT_EMPTY_PATH, nullptr);
}

std::unique_ptr<FileManager> makePosixFileManager(XdgDirectories dirs) {
  return std::make_unique<PosixFileManager>(std::move(dirs));
}

}  // namespace fbf
