// The main loop: one epoll loop on one thread serving a FIFO main queue (woken by an
// eventfd), file-descriptor sources and timers (timerfd). Requests, hardware events
// and registry notifications are all handled here, one at a time, in arrival order.
//
// BackgroundQueue is the only other thread: one worker running tasks, some after a
// delay. Its tasks must not touch main-loop state; they post back with RunLoop::Post.
//
// Sources and timers are owned by the handles they return: destroying the handle
// removes the source, also from inside its own callback.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <thread>

namespace brisvale {

class RunLoop;

// Removes its source or timer from the loop when destroyed. Movable, not copyable.
class SourceHandle {
 public:
  SourceHandle() = default;
  SourceHandle(SourceHandle&& other) noexcept;
  SourceHandle& operator=(SourceHandle&& other) noexcept;
  ~SourceHandle();
  SourceHandle(const SourceHandle&) = delete;
  SourceHandle& operator=(const SourceHandle&) = delete;

  explicit operator bool() const { return loop_ != nullptr; }
  void Reset();

 private:
  friend class RunLoop;
  SourceHandle(RunLoop* loop, uint64_t id) : loop_(loop), id_(id) {}
  RunLoop* loop_ = nullptr;
  uint64_t id_ = 0;
};

class RunLoop {
 public:
  using Task = std::function<void()>;
  using FdCallback = std::function<void(uint32_t epollEvents)>;
  using Clock = std::chrono::steady_clock;

  RunLoop();  // aborts only if epoll/eventfd cannot be created at all
  ~RunLoop();
  RunLoop(const RunLoop&) = delete;
  RunLoop& operator=(const RunLoop&) = delete;

  // Main queue. Post is safe from any thread; tasks run on the loop's thread in order.
  void Post(Task task);

  // Calls back on the loop thread while fd is ready for `events` (EPOLLIN, EPOLLOUT...).
  // The loop does not own fd.
  SourceHandle AddFd(int fd, uint32_t events, FdCallback callback);
  // AddFd without the loop's own duplicate of fd, for sources there are many of (one per
  // client connection): the caller keeps fd open until the handle is gone.
  SourceHandle WatchFd(int fd, uint32_t events, FdCallback callback);
  // Changes the events a source waits for (for instance to add EPOLLOUT while a
  // connection has bytes queued).
  bool ModifyFd(const SourceHandle& handle, uint32_t events);

  SourceHandle AddTimer(std::chrono::milliseconds delay, Task task);  // one shot
  SourceHandle AddRepeatingTimer(std::chrono::milliseconds interval, Task task);

  // Runs until Stop(). Returns at once if Stop() was called before.
  void Run();
  // Runs until `done` returns true (checked after every dispatched event), the
  // timeout passes or Stop() is called; returns done().
  bool RunUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout);
  // Runs for a bounded time (or until Stop()), then returns.
  void RunFor(std::chrono::milliseconds duration);
  // Dispatches what is ready now without waiting; returns the number of events handled.
  int RunOnce();
  void Stop();  // safe from any thread

 private:
  friend class SourceHandle;
  struct Source;
  void Remove(uint64_t id);
  SourceHandle Register(std::shared_ptr<Source> source, uint32_t events);
  // Handles what is ready (waiting up to timeoutMs for something), returning early once
  // `done` says so; what is left stays pending for the next call.
  int Dispatch(int timeoutMs, const std::function<bool()>* done = nullptr);

  int epollFd_ = -1;
  int wakeFd_ = -1;
  std::atomic<bool> stopped_ = false;
  uint64_t nextId_ = 1;
  std::map<uint64_t, std::shared_ptr<Source>> sources_;
  std::mutex queueMutex_;
  std::deque<Task> queue_;
};

// One worker thread with plain and delayed tasks. Pending tasks are dropped when the
// queue is destroyed; the destructor joins the worker.
class BackgroundQueue {
 public:
  BackgroundQueue();
  ~BackgroundQueue();
  BackgroundQueue(const BackgroundQueue&) = delete;
  BackgroundQueue& operator=(const BackgroundQueue&) = delete;

  void Post(std::function<void()> task);
  void PostAfter(std::chrono::milliseconds delay, std::function<void()> task);

 private:
  void Work();
  std::mutex mutex_;
  std::condition_variable wake_;
  std::multimap<std::chrono::steady_clock::time_point, std::function<void()>> tasks_;
  bool stopping_ = false;
  std::thread worker_;
};

}  // namespace brisvale
