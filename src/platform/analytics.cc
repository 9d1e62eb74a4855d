#include "platform/analytics.h"

#include "platform/logging.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <mutex>

namespace fbf {
namespace {

class JsonLinesAnalyticsSink final : public AnalyticsSink {
 public:
  JsonLinesAnalyticsSink(fs::path file, FileManager& fm, const Clock& clock)
      : file_(std::move(file)), fm_(fm), clock_(clock) {}

  void sendEvent(std::string_view name, const std::function<std::optional<nlohmann::json>()>& payload) override {
    auto body = payload ? payload() : std::nullopt;
    if (!body) return;
    nlohmann::json line = {{"time", secondsSinceEpoch(clock_.now())}, {"event", name}, {"payload", *body}};
    std::string text = line.dump() + "\n";
    logging::get("analytics").debug("{}", text.substr(0, text.size() - 1));

    std::lock_guard lock(mutex_);
    if (!ensureOpen()) return;
    // One write per line keeps lines whole with O_APPEND.
    if (write(fd_.get(), text.data(), text.size()) != static_cast<ssize_t>(text.size())) {
      logging::get("analytics").error("Short write to analytics file {}", file_.string());
    }
  }

 private:
  // The file stays open between events; it is opened again (created if need
  // be) when the path no longer leads to it, because it was removed or
  // rotated away. One stat(2) per event instead of an open and a close.
  bool ensureOpen() {
    struct stat byPath {};
    if (fd_.valid() && ::lstat(file_.c_str(), &byPath) == 0 && byPath.st_dev == device_ && byPath.st_ino == inode_) {
      return true;
    }
    fd_ = FileDescriptor();
    std::error_code ec;
    if (!fm_.createOrFixDirectory(file_.parent_path(), ec)) {
      logging::get("analytics").error("Cannot create analytics directory {}: {}", file_.parent_path().string(), ec.message());
      return false;
    }
    FileDescriptor fd(open(file_.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_NOFOLLOW | O_CLOEXEC, 0600));
    struct stat opened {};
    if (!fd.valid() || fstat(fd.get(), &opened) != 0) {
      logging::get("analytics").error("Cannot open analytics file {}", file_.string());
      return false;
    }
    fd_ = std::move(fd);
    device_ = opened.st_dev;
    inode_ = opened.st_ino;
    return true;
  }

 private:
  fs::path file_;
  FileManager& fm_;
  const Clock& clock_;
  std::mutex mutex_;
  FileDescriptor fd_;
  dev_t device_ = 0;
  ino_t inode_ = 0;
};

}  // namespace

std::unique_ptr<AnalyticsSink> makeJsonLinesAnalyticsSink(fs::path file, FileManager& fileManager, const Clock& clock) {
  return std::make_unique<JsonLinesAnalyticsSink>(std::move(file), fileManager, clock);
}

}  // namespace fbf
