// A daemon's IPC side running in-process: a real listening socket in a
// temporary runtime directory, a FlusherService over a real work queue, a
// flush runner and an installed-app controller that record what they are
// asked and complete when told. Clients connect over the socket from their
// own threads.
#pragma once

#include "assembly/fbf_strings.h"
#include "ipc/daemon_connection.h"
#include "ipc/flusher_service.h"
#include "support/process.h"
#include "support/test_support.h"

#include <gtest/gtest.h>

#include <asio.hpp>

#include <atomic>
#include <chrono>
#include <future>
#include <mutex>
#include <thread>

namespace fbf::testing {

// Polls `done` until it holds; gives up only after a generous bound, so a
// hang fails the test instead of blocking the suite.
inline bool eventually(const std::function<bool()>& done) { return waitUntil(done, std::chrono::seconds(20)); }

class FakeFlushRunner final : public FlushRunner {
 public:
  void flushAll(std::function<void()> completion) override { record("flushAll", std::move(completion)); }
  void flushCustomFeedbackType(const std::string& type, std::function<void()> completion) override {
    record("flushCustomFeedbackType " + type, std::move(completion));
  }
  std::optional<std::string> flushSessionEagerly(const fs::path& path, std::function<void()> completion) override {
    record("flushSessionEagerly " + path.string(), std::move(completion));
    return std::nullopt;
  }
  ipc::StatusReply status() override {
    ipc::StatusReply reply;
    reply.add_sessions()->set_files(3);
    return reply;
  }

  // When held, completions wait for `releaseAll` (called on the work queue).
  void holdCompletions(bool hold) { hold_ = hold; }
  void releaseAll() {
    std::vector<std::function<void()>> held;
    {
      std::lock_guard l(m_);
      held.swap(held_);
    }
    for (auto& c : held) c();
  }
  size_t heldCount() const {
    std::lock_guard l(m_);
    return held_.size();
  }
  std::vector<std::string> calls() const {
    std::lock_guard l(m_);
    return calls_;
  }

 private:
  void record(std::string call, std::function<void()> completion) {
    std::unique_lock l(m_);
    calls_.push_back(std::move(call));
    if (hold_) return held_.push_back(std::move(completion));
    l.unlock();
    completion();
  }

  mutable std::mutex m_;
  std::atomic<bool> hold_ = false;
  std::vector<std::string> calls_;
  std::vector<std::function<void()>> held_;
};

// Stores a signature derived from the condition, then completes.
class FakeInstalledAppController final : public InstalledAppControllerProtocol {
 public:
  explicit FakeInstalledAppController(UserDefaults& defaults) : defaults_(defaults) {}
  void updateWhitelists(uint64_t condition, std::function<void()> completion) override {
    conditions.push_back(condition);
    defaults_.setObject(FBFStrings::kVIRAppWhitelistSignatureKey, "signature-" + std::to_string(condition));
    if (completion) completion();
  }
  std::vector<uint64_t> conditions;  // work queue only

 private:
  UserDefaults& defaults_;
};

class IpcFixture : public ::testing::Test {
 protected:
  // Whether the assembly has an installed-app controller.
  virtual bool withWhitelistController() const { return true; }

  void SetUp() override {
    if (withWhitelistController()) {
      env.installedAppControllerFactory = [this](FBFAssembly& a) {
        auto c = std::make_unique<FakeInstalledAppController>(a.userDefaults());
        controller = c.get();
        return c;
      };
    }
    assembly = &env.assembly();
    runner = std::make_shared<FakeFlushRunner>();
    service = std::make_unique<FlusherService>(*assembly, runner);
    fs::create_directories(env.dirs.runtimeDir);
    acceptor.emplace(io, asio::local::stream_protocol::endpoint(socketPath().string()));
    acceptNext();
    ioThread = std::thread([this] { io.run(); });
  }

  void TearDown() override {
    closeListener();
    service.reset();
    ioIdle();  // let the closes run and their invalidations reach the work queue
    runner->holdCompletions(false);
    assembly->workloop().sync([this] {
      runner->releaseAll();
      assembly->setUploadListener(nullptr);
      assembly->setCohortsListener(nullptr);
    });
    guard.reset();
    io.stop();
    ioThread.join();
    // Handlers still queued (a channel's last close, posted back from the
    // work queue) hold the connections: run them out before tearing down.
    for (int i = 0; i < 3; ++i) {
      assembly->workloop().sync([] {});
      io.restart();
      io.poll();
    }
    env.assemblyPtr.reset();
  }

  // Runs `f` on the io thread and waits for it.
  void onIo(std::function<void()> f) {
    std::promise<void> done;
    asio::post(io, [&] {
      f();
      done.set_value();
    });
    done.get_future().wait();
  }
  void ioIdle() { onIo([] {}); }
  void closeListener() { onIo([this] { acceptor->close(); }); }

  fs::path socketPath() const { return env.dirs.socketPath(); }

  std::shared_ptr<ipc::DaemonConnection> connectClient() {
    std::string error;
    auto c = ipc::DaemonConnection::connect(socketPath(), &error);
    EXPECT_TRUE(c) << error;
    return c;
  }

  // What `f` returns when run on the work queue.
  template <class F>
  auto onWorkQueue(F f) {
    decltype(f()) result{};
    assembly->workloop().sync([&] { result = f(); });
    return result;
  }
  size_t openConnections() {
    return onWorkQueue([&] { return service->openConnectionCount(); });
  }
  std::shared_ptr<ClientConduit> uploadListener() {
    return onWorkQueue([&] { return assembly->uploadListener(); });
  }
  std::shared_ptr<ClientConduit> cohortsListener() {
    return onWorkQueue([&] { return assembly->cohortsListener(); });
  }
  std::vector<uint64_t> conditions() {
    return onWorkQueue([&] { return controller->conditions; });
  }

  LogCapture logs;
  asio::io_context io;
  asio::executor_work_guard<asio::io_context::executor_type> guard{io.get_executor()};
  TestEnvironment env{true};
  FBFAssembly* assembly = nullptr;
  FakeInstalledAppController* controller = nullptr;
  std::shared_ptr<FakeFlushRunner> runner;
  std::unique_ptr<FlusherService> service;
  std::optional<asio::local::stream_protocol::acceptor> acceptor;
  std::thread ioThread;

 private:
  void acceptNext() {
    acceptor->async_accept([this](const std::error_code& ec, asio::local::stream_protocol::socket socket) {
      if (ec) return;
      if (service) service->accept(std::move(socket));
      acceptNext();
    });
  }
};

// Sends one request and waits for its answer or for the reason none came.
struct Answer {
  std::optional<ipc::DaemonMessage> message;
  std::string error;
};
inline Answer ask(ipc::DaemonConnection& connection, ipc::Request request) {
  auto promise = std::make_shared<std::promise<Answer>>();
  auto future = promise->get_future();
  connection.send(
      std::move(request), [promise](const ipc::DaemonMessage& m) { promise->set_value({m, ""}); },
      [promise](const std::string& e) { promise->set_value({std::nullopt, e}); });
  return future.get();
}

}  // namespace fbf::testing
