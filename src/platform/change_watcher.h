// Change notifications for directories and files through inotify.
//
// Each watched directory reports entries created, deleted, moved in or out,
// and files closed after writing. A watch on a file is a watch on its
// directory filtered to the file's name, so that atomic replacements (write a
// temporary file, rename it over) are seen. The callback runs on the thread
// that runs the given io_context. Directories that do not exist are skipped.
#pragma once

#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <vector>

namespace asio {
class io_context;
}

namespace fbf {

class ChangeWatcher {
 public:
  virtual ~ChangeWatcher() = default;
};

struct WatchSpec {
  std::string tag;                  // handed to the callback
  std::filesystem::path directory;  // the directory to watch
  std::string onlyName;             // when set, only changes of this entry count
};

std::unique_ptr<ChangeWatcher> makeInotifyWatcher(asio::io_context& io, std::vector<WatchSpec> specs,
                                                  std::function<void(const std::string& tag)> onChange);

}  // namespace fbf
