#include "support/test_support.h"

#include "platform/logging.h"
#include "upload/device_context.h"

#include <algorithm>
#include <cstdlib>
#include <fstream>
#include <sstream>
#include <utility>

namespace fbf::testing {

// ---- ManualQueue ----

class ManualTimer final : public Timer {
 public:
  explicit ManualTimer(ManualQueue& q) : q_(q) {}
  ~ManualTimer() override { cancel(); }
  void schedule(std::chrono::steady_clock::duration delay, Task handler) override {
    cancel();
    id_ = q_.addDelayed(delay, std::move(handler));
  }
  void cancel() override {
    if (id_) q_.removeDelayed(id_);
    id_ = 0;
  }

 private:
  ManualQueue& q_;
  uint64_t id_ = 0;
};

void ManualQueue::async(Task task) {
  std::lock_guard l(m_);
  tasks_.push_back(std::move(task));
}

void ManualQueue::sync(const Task& task) {
  bool was = std::exchange(draining_, true);
  task();
  draining_ = was;
}

void ManualQueue::asyncAfter(std::chrono::steady_clock::duration delay, Task task) {
  addDelayed(delay, std::move(task));
}

std::unique_ptr<Timer> ManualQueue::makeTimer() { return std::make_unique<ManualTimer>(*this); }

uint64_t ManualQueue::addDelayed(std::chrono::steady_clock::duration delay, Task task) {
  std::lock_guard l(m_);
  uint64_t id = nextId_++;
  delayed_.push_back({now_ + delay, id, std::move(task)});
  return id;
}

void ManualQueue::removeDelayed(uint64_t id) {
  std::lock_guard l(m_);
  std::erase_if(delayed_, [id](const Delayed& d) { return d.id == id; });
}

size_t ManualQueue::drain() {
  size_t ran = 0;
  bool was = std::exchange(draining_, true);
  while (true) {
    Task t;
    {
      std::lock_guard l(m_);
      if (tasks_.empty()) break;
      t = std::move(tasks_.front());
      tasks_.pop_front();
    }
    t();
    ++ran;
  }
  draining_ = was;
  return ran;
}

void ManualQueue::advance(std::chrono::steady_clock::duration d) {
  auto target = now_ + d;
  while (true) {
    Delayed next;
    {
      std::lock_guard l(m_);
      auto it = std::min_element(delayed_.begin(), delayed_.end(),
                                 [](const Delayed& a, const Delayed& b) { return a.due < b.due || (a.due == b.due && a.id < b.id); });
      if (it == delayed_.end() || it->due > target) break;
      next = std::move(*it);
      delayed_.erase(it);
      now_ = next.due;
      tasks_.push_back(std::move(next.task));
    }
    drain();
  }
  now_ = target;
  drain();
}

// ---- TempDir ----

TempDir::TempDir() {
  std::string tmpl = (fs::temp_directory_path() / "fbf-test-XXXXXX").string();
  char* p = mkdtemp(tmpl.data());
  if (!p) std::abort();
  path_ = p;
}

TempDir::~TempDir() {
  std::error_code ec;
  fs::permissions(path_, fs::perms::owner_all, fs::perm_options::add, ec);
  fs::remove_all(path_, ec);
}

// ---- LogCapture ----

class LogCapture::Sink final : public spdlog::sinks::base_sink<std::mutex> {
 public:
  std::vector<std::string> lines() {
    std::lock_guard l(this->mutex_);
    return lines_;
  }

 protected:
  void sink_it_(const spdlog::details::log_msg& msg) override {
    lines_.emplace_back(msg.payload.data(), msg.payload.size());
  }
  void flush_() override {}

 private:
  std::vector<std::string> lines_;
};

LogCapture::LogCapture() : sink_(std::make_shared<Sink>()) {
  logging::setLevel(spdlog::level::trace);
  logging::addSink(sink_);
}
LogCapture::~LogCapture() { logging::removeSink(sink_); }
bool LogCapture::contains(const std::string& text) const { return count(text) > 0; }
size_t LogCapture::count(const std::string& text) const {
  auto l = sink_->lines();
  return std::count_if(l.begin(), l.end(), [&](const std::string& s) { return s.find(text) != std::string::npos; });
}

// ---- RecordingAnalytics ----

void RecordingAnalytics::sendEvent(std::string_view name, const std::function<std::optional<nlohmann::json>()>& payload) {
  auto body = payload();
  if (!body) return;
  std::lock_guard l(m_);
  events_.emplace_back(std::string(name), *body);
}

std::vector<std::pair<std::string, nlohmann::json>> RecordingAnalytics::events() const {
  std::lock_guard l(m_);
  return events_;
}

// ---- files ----

void writeFile(const fs::path& path, std::string_view bytes) {
  fs::create_directories(path.parent_path());
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  if (!out.write(bytes.data(), static_cast<std::streamsize>(bytes.size())).flush()) std::abort();
  fs::permissions(path, fs::perms::owner_read | fs::perms::owner_write);
}

std::string readFile(const fs::path& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

// ---- TestEnvironment ----

namespace {
class FixedDeviceInfo final : public DeviceInfo {
 public:
  std::optional<std::string> value(std::string_view key) const override {
    if (key == "ProductType") return "TestBox1,1";
    if (key == "ProductName") return "TestOS";
    if (key == "ProductVersion") return "1.0";
    if (key == "BuildVersion") return "1A100";
    return std::nullopt;
  }
  std::optional<std::string> localeIdentifier() const override { return "en_US"; }
  std::optional<std::string> countryCode() const override { return "US"; }
};
}  // namespace

TestEnvironment::TestEnvironment(bool realWorkQueue)
    : dirs(XdgDirectories::underRoot(temp.path())),
      fileManager(makePosixFileManager(dirs)),
      preferences(makePlistPreferencesStore(dirs.preferencesDir(), *fileManager)),
      clock(std::make_shared<FakeClock>()),
      analytics(std::make_shared<RecordingAnalytics>()),
      transactions(std::make_shared<TransactionRegistry>(nullptr)) {
  if (!realWorkQueue) manualQueue = std::make_shared<ManualQueue>("vireon-fbf.workloop");
  fs::create_directories(cacheDir());
}

TestEnvironment::~TestEnvironment() {
  if (manualQueue) manualQueue->drain();
  assemblyPtr.reset();
}

FBFAssembly& TestEnvironment::assembly() {
  if (!assemblyPtr) {
    FBFAssemblyDependencies deps;
    deps.preferences = preferences;
    deps.fileManager = fileManager;
    deps.clock = clock;
    deps.analytics = analytics;
    deps.transactions = transactions;
    FixedDeviceInfo info;
    deps.deviceContext = std::make_shared<DeviceContext>(info, "vireon-fbf/test");
    deps.workloop = manualQueue;
    deps.httpSessionFactory = httpSessionFactory;
    deps.installedAppControllerFactory = installedAppControllerFactory;
    assemblyPtr = std::make_unique<FBFAssembly>(std::move(deps));
  }
  return *assemblyPtr;
}

void TestEnvironment::writeBag(const nlohmann::json& values) {
  writeFile(cacheDir() / "bag.plist", serializePropertyList(values, PropertyListFormat::xml));
}

}  // namespace fbf::testing
