#include "base/runloop.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace brisvale {
namespace {

constexpr uint64_t kWakeId = 0;  // epoll data of the main-queue eventfd; sources start at 1
constexpr int kMaxEventsPerWait = 64;

[[noreturn]] void Fatal(const char* what) {
  std::fprintf(stderr, "runloop: %s: %s\n", what, std::strerror(errno));
  std::abort();
}

void DrainCounter(int fd) {
  uint64_t count;
  while (::read(fd, &count, sizeof count) < 0 && errno == EINTR) {
  }
}

timespec ToTimespec(std::chrono::nanoseconds duration) {
  timespec ts{};
  ts.tv_sec = static_cast<time_t>(duration.count() / 1'000'000'000);
  ts.tv_nsec = static_cast<long>(duration.count() % 1'000'000'000);
  return ts;
}

}  // namespace

// A source normally keeps its own descriptor: a duplicate of the caller's fd, or its
// timerfd. Registering the duplicate means removal always finds the registration, even
// when the caller has already closed its fd or a spawned child still holds the file
// open, and two sources may watch the same fd. WatchFd sources borrow the caller's.
struct RunLoop::Source {
  int fd = -1;
  bool owned = true;
  bool isTimer = false;
  bool repeating = false;
  FdCallback onReady;
  Task onTimer;
  ~Source() {
    if (owned && fd >= 0) ::close(fd);
  }
};

SourceHandle::SourceHandle(SourceHandle&& other) noexcept : loop_(other.loop_), id_(other.id_) {
  other.loop_ = nullptr;
  other.id_ = 0;
}

SourceHandle& SourceHandle::operator=(SourceHandle&& other) noexcept {
  if (this != &other) {
    Reset();
    loop_ = other.loop_;
    id_ = other.id_;
    other.loop_ = nullptr;
    other.id_ = 0;
  }
  return *this;
}

SourceHandle::~SourceHandle() { Reset(); }

void SourceHandle::Reset() {
  if (loop_) {
    RunLoop* loop = loop_;
    loop_ = nullptr;
    loop->Remove(id_);
  }
  id_ = 0;
}

RunLoop::RunLoop() {
  epollFd_ = ::epoll_create1(EPOLL_CLOEXEC);
  if (epollFd_ < 0) Fatal("epoll_create1");
  wakeFd_ = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (wakeFd_ < 0) Fatal("eventfd");
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.u64 = kWakeId;
  if (::epoll_ctl(epollFd_, EPOLL_CTL_ADD, wakeFd_, &event) < 0) Fatal("epoll_ctl");
}

RunLoop::~RunLoop() {
  sources_.clear();
  ::close(wakeFd_);
  ::close(epollFd_);
}

void RunLoop::Post(Task task) {
  {
    std::lock_guard lock(queueMutex_);
    queue_.push_back(std::move(task));
  }
  uint64_t one = 1;
  while (::write(wakeFd_, &one, sizeof one) < 0 && errno == EINTR) {
  }
}

SourceHandle RunLoop::AddFd(int fd, uint32_t events, FdCallback callback) {
  auto source = std::make_shared<Source>();
  source->fd = ::fcntl(fd, F_DUPFD_CLOEXEC, 0);
  if (source->fd < 0) return {};
  source->onReady = std::move(callback);
  return Register(std::move(source), events);
}

SourceHandle RunLoop::WatchFd(int fd, uint32_t events, FdCallback callback) {
  auto source = std::make_shared<Source>();
  source->fd = fd;
  source->owned = false;
  source->onReady = std::move(callback);
  return Register(std::move(source), events);
}

SourceHandle RunLoop::Register(std::shared_ptr<Source> source, uint32_t events) {
  uint64_t id = nextId_++;
  epoll_event event{};
  event.events = events;
  event.data.u64 = id;
  if (::epoll_ctl(epollFd_, EPOLL_CTL_ADD, source->fd, &event) < 0) return {};
  sources_.emplace(id, std::move(source));
  return SourceHandle(this, id);
}

bool RunLoop::ModifyFd(const SourceHandle& handle, uint32_t events) {
  if (handle.loop_ != this) return false;
  auto it = sources_.find(handle.id_);
  if (it == sources_.end() || it->second->isTimer) return false;
  epoll_event event{};
  event.events = events;
  event.data.u64 = handle.id_;
  return ::epoll_ctl(epollFd_, EPOLL_CTL_MOD, it->second->fd, &event) == 0;
}

namespace {

// A zero it_value would disarm the timer, so "now" is one nanosecond away.
itimerspec TimerSpec(std::chrono::milliseconds delay, std::chrono::milliseconds interval) {
  itimerspec timer{};
  std::chrono::nanoseconds first = delay;
  if (first <= std::chrono::nanoseconds::zero()) first = std::chrono::nanoseconds(1);
  timer.it_value = ToTimespec(first);
  timer.it_interval = ToTimespec(interval);
  return timer;
}

}  // namespace

SourceHandle RunLoop::AddTimer(std::chrono::milliseconds delay, Task task) {
  auto source = std::make_shared<Source>();
  source->isTimer = true;
  source->onTimer = std::move(task);
  source->fd = ::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK);
  if (source->fd < 0) return {};
  itimerspec timer = TimerSpec(delay, std::chrono::milliseconds::zero());
  if (::timerfd_settime(source->fd, 0, &timer, nullptr) < 0) return {};
  return Register(std::move(source), EPOLLIN);
}

SourceHandle RunLoop::AddRepeatingTimer(std::chrono::milliseconds interval, Task task) {
  if (interval < std::chrono::milliseconds(1)) interval = std::chrono::milliseconds(1);
  SourceHandle handle = AddTimer(interval, std::move(task));
  if (!handle) return handle;
  Source& source = *sources_.at(handle.id_);
  source.repeating = true;
  itimerspec timer = TimerSpec(interval, interval);
  if (::timerfd_settime(source.fd, 0, &timer, nullptr) < 0) return {};
  return handle;
}

void RunLoop::Remove(uint64_t id) {
  auto it = sources_.find(id);
  if (it == sources_.end()) return;
  // The descriptor closes (and leaves the epoll set) once the last reference goes,
  // which is after the callback that may be running right now returns.
  ::epoll_ctl(epollFd_, EPOLL_CTL_DEL, it->second->fd, nullptr);
  sources_.erase(it);
}

int RunLoop::Dispatch(int timeoutMs, const std::function<bool()>* done) {
  auto finished = [&] { return done && (*done)(); };
  {
    std::lock_guard lock(queueMutex_);
    if (!queue_.empty()) timeoutMs = 0;
  }
  epoll_event events[kMaxEventsPerWait];
  int count = ::epoll_wait(epollFd_, events, kMaxEventsPerWait, timeoutMs);
  if (count < 0) return 0;  // EINTR: the caller loops
  int handled = 0;
  // Level-triggered sources and unread timers report again if this batch ends early.
  for (int i = 0; i < count; ++i) {
    uint64_t id = events[i].data.u64;
    if (id == kWakeId) {
      DrainCounter(wakeFd_);
      continue;
    }
    // A source removed by an earlier callback of this batch is gone from the map and
    // its event is dropped here.
    auto it = sources_.find(id);
    if (it == sources_.end()) continue;
    std::shared_ptr<Source> source = it->second;
    ++handled;
    if (!source->isTimer) {
      source->onReady(events[i].events);
    } else {
      DrainCounter(source->fd);
      if (source->repeating) {
        source->onTimer();
      } else {
        Task task = std::move(source->onTimer);
        Remove(id);
        task();
      }
    }
    if (finished()) return handled;
  }
  // Then the tasks posted so far, in order; a task posted by one of them waits for the
  // next round, so a task that keeps reposting cannot starve the sources.
  size_t pending;
  {
    std::lock_guard lock(queueMutex_);
    pending = queue_.size();
  }
  for (; pending > 0; --pending) {
    Task task;
    {
      std::lock_guard lock(queueMutex_);
      if (queue_.empty()) break;
      task = std::move(queue_.front());
      queue_.pop_front();
    }
    task();
    ++handled;
    if (finished()) break;
  }
  return handled;
}

void RunLoop::Run() {
  const std::function<bool()> stopped = [this] { return stopped_.load(); };
  while (!stopped_.exchange(false)) {
    Dispatch(-1, &stopped);
  }
}

bool RunLoop::RunUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout) {
  const std::function<bool()> finished = [&] { return stopped_.load() || done(); };
  auto deadline = Clock::now() + timeout;
  while (!done()) {
    if (stopped_.exchange(false)) break;
    auto remaining = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
    if (remaining.count() <= 0) break;
    Dispatch(static_cast<int>(std::min<int64_t>(remaining.count(), 1000)), &finished);
  }
  return done();
}

void RunLoop::RunFor(std::chrono::milliseconds duration) {
  RunUntil([] { return false; }, duration);
}

int RunLoop::RunOnce() { return Dispatch(0); }

void RunLoop::Stop() {
  stopped_ = true;
  uint64_t one = 1;
  while (::write(wakeFd_, &one, sizeof one) < 0 && errno == EINTR) {
  }
}

BackgroundQueue::BackgroundQueue() : worker_([this] { Work(); }) {}

BackgroundQueue::~BackgroundQueue() {
  {
    std::lock_guard lock(mutex_);
    stopping_ = true;
  }
  wake_.notify_all();
  worker_.join();
}

void BackgroundQueue::Post(std::function<void()> task) {
  PostAfter(std::chrono::milliseconds::zero(), std::move(task));
}

void BackgroundQueue::PostAfter(std::chrono::milliseconds delay, std::function<void()> task) {
  {
    std::lock_guard lock(mutex_);
    // Equal deadlines keep posting order: multimap inserts after equal keys.
    tasks_.emplace(std::chrono::steady_clock::now() + delay, std::move(task));
  }
  wake_.notify_one();
}

void BackgroundQueue::Work() {
  std::unique_lock lock(mutex_);
  while (!stopping_) {
    if (tasks_.empty()) {
      wake_.wait(lock);
      continue;
    }
    auto first = tasks_.begin();
    if (first->first > std::chrono::steady_clock::now()) {
      wake_.wait_until(lock, first->first);
      continue;
    }
    std::function<void()> task = std::move(first->second);
    tasks_.erase(first);
    lock.unlock();
    task();
    lock.lock();
  }
}

}  // namespace brisvale
