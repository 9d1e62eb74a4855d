#include "platform/task_queue.h"

#include <asio.hpp>

#include <pthread.h>

#include <future>
#include <thread>

namespace fbf {
namespace {

thread_local const void* tCurrentQueue = nullptr;

class AsioTimer final : public Timer {
 public:
  explicit AsioTimer(asio::io_context& io) : timer_(io) {}
  ~AsioTimer() override { cancel(); }

  // The generation counter is shared with pending handlers so a handler that
  // was already dequeued when the timer was re-armed or destroyed does nothing.
  void schedule(std::chrono::steady_clock::duration delay, Task handler) override {
    auto gen = ++*generation_;
    timer_.expires_after(delay);
    timer_.async_wait([generation = generation_, gen, handler = std::move(handler)](
                          const std::error_code& ec) {
      if (ec || gen != generation->load()) return;
      handler();
    });
  }
  void cancel() override {
    ++*generation_;
    timer_.cancel();
  }

 private:
  asio::steady_timer timer_;
  std::shared_ptr<std::atomic<uint64_t>> generation_ = std::make_shared<std::atomic<uint64_t>>(0);
};

class AsioSerialQueue final : public TaskQueue {
 public:
  explicit AsioSerialQueue(std::string label)
      : label_(std::move(label)), work_(asio::make_work_guard(io_)) {
    thread_ = std::thread([this] {
      // Named after the label's last part ("encoder"), so `top -H` and a
      // profile tell the pipeline's stages apart (16 bytes at most).
      std::string name = label_.substr(label_.rfind('.') + 1).substr(0, 15);
      pthread_setname_np(pthread_self(), name.c_str());
      tCurrentQueue = this;
      io_.run();
      tCurrentQueue = nullptr;
    });
  }
  ~AsioSerialQueue() override { shutdown(); }

  void shutdown() override {
    work_.reset();
    io_.stop();
    if (thread_.joinable()) {
      if (thread_.get_id() == std::this_thread::get_id()) {
        thread_.detach();
      } else {
        thread_.join();
      }
    }
  }

  const std::string& label() const override { return label_; }
  void async(Task task) override { asio::post(io_, std::move(task)); }
  void sync(const Task& task) override {
    if (isCurrent()) {
      task();
      return;
    }
    std::promise<void> done;
    asio::post(io_, [&] {
      task();
      done.set_value();
    });
    done.get_future().wait();
  }
  void asyncAfter(std::chrono::steady_clock::duration delay, Task task) override {
    auto timer = std::make_shared<asio::steady_timer>(io_, delay);
    timer->async_wait([timer, task = std::move(task)](const std::error_code& ec) {
      if (!ec) task();
    });
  }
  bool isCurrent() const override { return tCurrentQueue == this; }
  std::unique_ptr<Timer> makeTimer() override { return std::make_unique<AsioTimer>(io_); }

 private:
  std::string label_;
  asio::io_context io_;
  asio::executor_work_guard<asio::io_context::executor_type> work_;
  std::thread thread_;
};

}  // namespace

std::unique_ptr<TaskQueue> makeSerialQueue(std::string label) {
  return std::make_unique<AsioSerialQueue>(std::move(label));
}

}  // namespace fbf
