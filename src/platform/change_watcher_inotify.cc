#include "platform/change_watcher.h"

#include "platform/logging.h"

#include <asio.hpp>
#include <sys/inotify.h>
#include <unistd.h>

#include <map>

namespace fbf {
namespace {

class InotifyWatcher final : public ChangeWatcher {
 public:
  InotifyWatcher(asio::io_context& io, std::vector<WatchSpec> specs, std::function<void(const std::string&)> cb)
      : stream_(io), callback_(std::move(cb)) {
    int fd = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    if (fd < 0) {
      logging::get("main").error("inotify unavailable; change notifications are off");
      return;
    }
    stream_.assign(fd);
    for (auto& spec : specs) {
      int wd = inotify_add_watch(fd, spec.directory.c_str(),
                                 IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_CLOSE_WRITE | IN_ONLYDIR |
                                     IN_DONT_FOLLOW);
      if (wd < 0) {
        logging::get("main").debug("Not watching {}: it does not exist or cannot be watched", spec.directory.string());
        continue;
      }
      watches_.emplace(wd, spec);
    }
    read();
  }

  ~InotifyWatcher() override {
    std::error_code ec;
    stream_.close(ec);
  }

 private:
  void read() {
    if (!stream_.is_open()) return;
    stream_.async_read_some(asio::buffer(buffer_), [this](const std::error_code& ec, size_t n) {
      if (ec) return;  // closed
      dispatch(n);
      read();
    });
  }

  void dispatch(size_t n) {
    size_t off = 0;
    while (off + sizeof(inotify_event) <= n) {
      auto* ev = reinterpret_cast<const inotify_event*>(buffer_.data() + off);
      off += sizeof(inotify_event) + ev->len;
      auto range = watches_.equal_range(ev->wd);
      std::string name = ev->len ? std::string(ev->name) : std::string();
      for (auto it = range.first; it != range.second; ++it) {
        if (!it->second.onlyName.empty() && it->second.onlyName != name) continue;
        callback_(it->second.tag);
      }
    }
  }

  asio::posix::stream_descriptor stream_;
  std::function<void(const std::string&)> callback_;
  std::multimap<int, WatchSpec> watches_;
  alignas(inotify_event) std::array<char, 16384> buffer_{};
};

}  // namespace

std::unique_ptr<ChangeWatcher> makeInotifyWatcher(asio::io_context& io, std::vector<WatchSpec> specs,
                                                  std::function<void(const std::string& tag)> onChange) {
  return std::make_unique<InotifyWatcher>(io, std::move(specs), std::move(onChange));
}

}  // namespace fbf
