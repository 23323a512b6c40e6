// The main loop: its queue, descriptor sources, timers and the background queue.
#include "base/runloop.h"

#include <gtest/gtest.h>
#include <sys/epoll.h>
#include <unistd.h>

#include <optional>
#include <string>
#include <vector>

namespace brisvale {
namespace {

using namespace std::chrono_literals;

struct Pipe {
  int fds[2] = {-1, -1};
  const int& read = fds[0];
  Pipe() {
    EXPECT_EQ(pipe(fds), 0);
    Fill();
  }
  ~Pipe() { close(fds[0]), close(fds[1]); }
  void Fill() { EXPECT_EQ(write(fds[1], "x", 1), 1); }
};

TEST(RunLoop, RunUntilChecksAfterEachTaskAndTimesOutAndStopEndsRun) {
  RunLoop loop;
  int ran = 0;
  loop.Post([&] { ++ran; });
  loop.Post([&] { ++ran; });
  EXPECT_TRUE(loop.RunUntil([&] { return ran == 1; }, 1s));
  EXPECT_EQ(ran, 1);  // the second task is still queued
  EXPECT_EQ(loop.RunOnce(), 1);
  EXPECT_EQ(ran, 2);

  auto start = RunLoop::Clock::now();
  EXPECT_FALSE(loop.RunUntil([] { return false; }, 60ms));
  auto elapsed = RunLoop::Clock::now() - start;
  EXPECT_GE(elapsed, 60ms);
  EXPECT_LT(elapsed, 1s);

  // Stop ends Run before it starts, and from a task, whatever is still queued.
  loop.Stop();
  loop.Run();  // returns at once

  ran = 0;
  loop.Post([&] { ++ran; loop.Stop(); });
  loop.Post([&] { ++ran; });
  loop.Run();
  EXPECT_EQ(ran, 1);
}

TEST(RunLoop, SourceRemovedInsideACallbackIsNeverCalledAgainAndSourcesMayShareAnFd) {
  RunLoop loop;
  Pipe a, b, self;  // each holds a byte
  // Both are ready in the same batch; whichever runs first removes the other.
  int calls = 0, selfCalls = 0;
  SourceHandle first, second, own;
  first = loop.AddFd(a.read, EPOLLIN, [&](uint32_t) { ++calls; second.Reset(); first.Reset(); });
  second = loop.AddFd(b.read, EPOLLIN, [&](uint32_t) { ++calls; first.Reset(); second.Reset(); });
  // Never drained: it stays ready, so only the removal keeps it quiet.
  own = loop.AddFd(self.read, EPOLLIN, [&](uint32_t events) {
    EXPECT_TRUE(events & EPOLLIN);
    ++selfCalls;
    own = SourceHandle();
  });
  EXPECT_EQ(loop.RunOnce(), 2);
  self.Fill();
  loop.RunFor(30ms);
  EXPECT_EQ(calls, 1);
  EXPECT_EQ(selfCalls, 1);

  // Two sources may watch one descriptor.
  int bothCalls = 0;
  SourceHandle one = loop.AddFd(a.read, EPOLLIN, [&](uint32_t) { ++bothCalls; });
  SourceHandle two = loop.AddFd(a.read, EPOLLIN, [&](uint32_t) { ++bothCalls; });
  ASSERT_TRUE(one && two);
  EXPECT_EQ(loop.RunOnce(), 2);
  EXPECT_EQ(bothCalls, 2);
}

TEST(RunLoop, TimersFireInDeadlineOrderAndRepeatUntilTheirHandleGoes) {
  RunLoop loop;
  std::string order;
  SourceHandle c = loop.AddTimer(60ms, [&] { order += 'c'; });
  SourceHandle a = loop.AddTimer(0ms, [&] { order += 'a'; });
  SourceHandle b = loop.AddTimer(30ms, [&] { order += 'b'; });
  SourceHandle cancelled = loop.AddTimer(10ms, [&] { order += 'x'; });
  cancelled.Reset();
  EXPECT_TRUE(loop.RunUntil([&] { return order.size() == 3; }, 2s));
  EXPECT_EQ(order, "abc");

  int ticks = 0;
  SourceHandle repeating;
  repeating = loop.AddRepeatingTimer(5ms, [&] {
    if (++ticks == 4) repeating.Reset();
  });
  EXPECT_TRUE(loop.RunUntil([&] { return ticks == 4; }, 2s));
  loop.RunFor(30ms);
  EXPECT_EQ(ticks, 4);
}

TEST(BackgroundQueue, RunsTasksByDeadlineAndPostsBack) {
  RunLoop loop;
  std::vector<std::string> order;  // touched only on the loop thread
  auto report = [&](std::string name) {
    return [&loop, &order, name] { loop.Post([&order, name] { order.push_back(name); }); };
  };
  std::optional<BackgroundQueue> queue(std::in_place);
  queue->PostAfter(60ms, report("late"));
  queue->PostAfter(20ms, report("soon"));
  queue->Post(report("now"));
  queue->Post(report("now too"));
  queue->PostAfter(10s, report("dropped"));
  EXPECT_TRUE(loop.RunUntil([&] { return order.size() == 4; }, 2s));

  auto start = std::chrono::steady_clock::now();
  queue.reset();  // must not wait for the 10-second task
  EXPECT_LT(std::chrono::steady_clock::now() - start, 1s);
  loop.RunFor(20ms);
  EXPECT_EQ(order, (std::vector<std::string>{"now", "now too", "soon", "late"}));
}

}  // namespace
}  // namespace brisvale
