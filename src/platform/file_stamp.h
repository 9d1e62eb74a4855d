// What stat(2) says of a file, to tell whether something read from it earlier
// still holds: equal stamps mean the same file with the same content, as far
// as the file system can tell. The identity (device, inode) catches
// replacement by rename, since the new file exists beside the old one before
// the rename and so never has its inode; the size and the modification and
// change times catch edits in place.
#pragma once

#include <sys/stat.h>

#include <filesystem>

namespace fbf {

struct FileStamp {
  bool exists = false;
  dev_t device = 0;
  ino_t inode = 0;
  off_t size = 0;
  timespec modified{};
  timespec changed{};

  // Does not follow a symbolic link (nor do the reads it guards); a file
  // that cannot be stat'ed does not exist.
  static FileStamp of(const std::filesystem::path& file) {
    FileStamp stamp;
    struct stat st {};
    if (::lstat(file.c_str(), &st) != 0) return stamp;
    stamp.exists = true;
    stamp.device = st.st_dev;
    stamp.inode = st.st_ino;
    stamp.size = st.st_size;
    stamp.modified = st.st_mtim;
    stamp.changed = st.st_ctim;
    return stamp;
  }

  bool operator==(const FileStamp& o) const {
    return exists == o.exists && device == o.device && inode == o.inode && size == o.size &&
           modified.tv_sec == o.modified.tv_sec && modified.tv_nsec == o.modified.tv_nsec &&
           changed.tv_sec == o.changed.tv_sec && changed.tv_nsec == o.changed.tv_nsec;
  }
};

}  // namespace fbf
