// Serial task queues and one-shot timers.
//
// Contract of every TaskQueue: tasks run one at a time, in the order they were
// posted, on the queue's own sequence; `async` never runs the task inside the
// call; posting is safe from any thread. `sync` runs the task on the queue and
// waits for it; called from the queue itself it runs the task inline instead of
// deadlocking.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>

namespace fbf {

using Task = std::function<void()>;

// A one-shot timer bound to a queue. `schedule` (re-)arms it, replacing any
// pending firing; `cancel` disarms it. The handler runs on the owning queue.
// Destroying the timer cancels it.
class Timer {
 public:
  virtual ~Timer() = default;
  virtual void schedule(std::chrono::steady_clock::duration delay, Task handler) = 0;
  virtual void cancel() = 0;
};

class TaskQueue {
 public:
  virtual ~TaskQueue() = default;
  virtual const std::string& label() const = 0;
  virtual void async(Task task) = 0;
  virtual void sync(const Task& task) = 0;
  virtual void asyncAfter(std::chrono::steady_clock::duration delay, Task task) = 0;
  virtual bool isCurrent() const = 0;
  virtual std::unique_ptr<Timer> makeTimer() = 0;
  // Lets the task in progress finish, drops the rest and stops the queue's
  // thread; nothing runs afterwards. Not to be called from the queue itself.
  virtual void shutdown() {}
};

// A queue backed by an Asio io_context run by exactly one thread of its own.
// The thread starts in the constructor and is joined by `shutdown` or the
// destructor; tasks still queued then are dropped.
std::unique_ptr<TaskQueue> makeSerialQueue(std::string label);

}  // namespace fbf
