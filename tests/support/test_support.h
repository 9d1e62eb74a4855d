// Fakes and fixtures shared by the test groups: a clock you move, a queue you
// drain by hand, a temporary XDG home, captured log lines, and an assembly
// wired to all of them.
#pragma once

#include "assembly/fbf_assembly.h"

#include <spdlog/sinks/base_sink.h>

#include <atomic>
#include <deque>
#include <mutex>
#include <string>
#include <vector>

namespace fbf::testing {

// Read from any thread; moved by the test's own thread only.
class FakeClock final : public Clock {
 public:
  explicit FakeClock(SystemTime start = std::chrono::system_clock::now()) : now_(start) {}
  SystemTime now() const override { return now_; }
  void set(SystemTime t) { now_ = t; }
  void advance(std::chrono::system_clock::duration d) { now_ = now_.load() + d; }

 private:
  std::atomic<SystemTime> now_;
};

// Runs nothing until drained; timers fire when time is advanced by hand.
class ManualQueue final : public TaskQueue {
 public:
  explicit ManualQueue(std::string label = "manual") : label_(std::move(label)) {}
  const std::string& label() const override { return label_; }
  void async(Task task) override;
  void sync(const Task& task) override;
  void asyncAfter(std::chrono::steady_clock::duration delay, Task task) override;
  bool isCurrent() const override { return draining_; }
  std::unique_ptr<Timer> makeTimer() override;

  // Runs queued tasks (including ones they post) until none is left.
  size_t drain();
  // Moves the queue's time forward, queueing due timers, then drains.
  void advance(std::chrono::steady_clock::duration d);

 private:
  friend class ManualTimer;
  struct Delayed {
    std::chrono::steady_clock::duration due;
    uint64_t id;
    Task task;
  };
  uint64_t addDelayed(std::chrono::steady_clock::duration delay, Task task);
  void removeDelayed(uint64_t id);

  std::string label_;
  mutable std::mutex m_;
  std::deque<Task> tasks_;
  std::vector<Delayed> delayed_;
  std::chrono::steady_clock::duration now_{0};
  uint64_t nextId_ = 1;
  bool draining_ = false;
};

class TempDir {
 public:
  TempDir();
  ~TempDir();
  const fs::path& path() const { return path_; }

 private:
  fs::path path_;
};

// Captures every log line while alive.
class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  bool contains(const std::string& text) const;
  size_t count(const std::string& text) const;

 private:
  class Sink;
  std::shared_ptr<Sink> sink_;
};

class RecordingAnalytics final : public AnalyticsSink {
 public:
  void sendEvent(std::string_view name, const std::function<std::optional<nlohmann::json>()>& payload) override;
  std::vector<std::pair<std::string, nlohmann::json>> events() const;

 private:
  mutable std::mutex m_;
  std::vector<std::pair<std::string, nlohmann::json>> events_;
};

// A listener that keeps every cohort feedback it is sent.
class RecordingConduit final : public ClientConduit {
 public:
  void willUploadData(const std::string&, const std::string&) override {}
  void willGenerateCohortFeebacks(const std::string& data) override { received.push_back(data); }
  std::vector<std::string> received;
};

// An upload session that keeps each task for the test to answer; invalidating
// it tells its owner at once, as a real one does when no task is left.
class FakeHttpSession final : public HttpClientSession {
 public:
  explicit FakeHttpSession(HttpSessionConfiguration c) : config(std::move(c)) {}
  void uploadFile(HttpRequest request, fs::path body, HttpCompletion completion) override {
    tasks.push_back({std::move(request), std::move(body), std::move(completion)});
  }
  void finishTasksAndInvalidate() override { config.onInvalidated(); }
  void cancelAllTasks() override {}

  struct Task {
    HttpRequest request;
    fs::path body;
    HttpCompletion completion;
  };
  HttpSessionConfiguration config;
  std::vector<Task> tasks;
};

// Writes `bytes` to `path` (creating parent directories), mode 0600.
void writeFile(const fs::path& path, std::string_view bytes);
std::string readFile(const fs::path& path);

// A temporary XDG home with the real file manager and preferences, a fake
// clock, recorded analytics and an FBFAssembly over them. The cache directory
// "<root>/cache/vireond" exists. By default the work queue is a ManualQueue.
struct TestEnvironment {
  explicit TestEnvironment(bool realWorkQueue = false);
  ~TestEnvironment();

  TempDir temp;
  XdgDirectories dirs;
  std::shared_ptr<FileManager> fileManager;
  std::shared_ptr<PreferencesStore> preferences;
  std::shared_ptr<FakeClock> clock;
  std::shared_ptr<RecordingAnalytics> analytics;
  std::shared_ptr<TransactionRegistry> transactions;
  std::shared_ptr<ManualQueue> manualQueue;  // null with a real work queue
  HttpSessionFactory httpSessionFactory;     // set before first use of assembly()
  decltype(FBFAssemblyDependencies::installedAppControllerFactory) installedAppControllerFactory;  // likewise
  std::unique_ptr<FBFAssembly> assemblyPtr;

  fs::path cacheDir() const { return dirs.cacheHome / "vireond"; }
  FBFAssembly& assembly();
  // Writes bag.plist (XML) with the given values.
  void writeBag(const nlohmann::json& values);
  UserDefaults& defaults() { return assembly().userDefaults(); }
};

}  // namespace fbf::testing
