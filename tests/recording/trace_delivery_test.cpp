// Recording must never harm the program that records: while the journal ends or is full, after the
// program closed or reused descriptors, after a fork, in threads, and when it is switched off.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <atomic>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "TraceTest.h"

extern "C" {
int record_while_disabled(void);
bool enabled_while_disabled(void);
int record_from_second_unit(void);
}

namespace {

using TraceDelivery = TraceTest;

TEST_F(TraceDelivery, ErrnoBelongsToTheCaller) {
  const tessel_point point = somePoint();
  journal.stop();
  errno = EDOM;
  EXPECT_NE(tessel_event(&point), 0);
  EXPECT_EQ(errno, EDOM);
}

TEST_F(TraceDelivery, SurvivesTheJournal) {
  const tessel_point point = somePoint();
  journal.stop();
  EXPECT_EQ(tessel_event(&point), ENOENT);
  journal.start();
  EXPECT_EQ(tessel_event(&point), 0);
  journal.stop();
  EXPECT_NE(tessel_event(&point), 0);
  journal.start();
  EXPECT_EQ(tessel_event(&point), 0);
  EXPECT_EQ(journal.take().size(), 1u);
  EXPECT_EQ(traceSockets().size(), 1u);
}

TEST_F(TraceDelivery, WritesIntoNoDescriptorThatBecameAnothers) {
  const tessel_point point = somePoint();
  ASSERT_EQ(tessel_event(&point), 0);
  ASSERT_EQ(traceSockets().size(), 1u);
  const int fd = traceSockets().front();
  int pair[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_DGRAM | SOCK_NONBLOCK, 0, pair), 0);
  dup2(pair[0], fd);
  EXPECT_EQ(tessel_event(&point), 0);
  char byte = 0;
  EXPECT_EQ(recv(pair[1], &byte, 1, 0), -1);
  EXPECT_EQ(journal.take().size(), 2u);
  for (const int each : {fd, pair[0], pair[1]}) close(each);
}

TEST_F(TraceDelivery, KeepsOffTheStandardStreams) {
  const int input = dup(0);
  const tessel_point point = somePoint();
  close(0);
  EXPECT_EQ(tessel_event(&point), 0);
  EXPECT_EQ(fcntl(0, F_GETFD), -1);
  dup2(input, 0);
  close(input);
}

TEST_F(TraceDelivery, ThreadsShareOneSocketAndLoseNothing) {
  constexpr int kThreads = 8;
  constexpr int kEach = 200;
  std::atomic<int> running = kThreads;
  std::vector<std::thread> threads;
  threads.reserve(kThreads);
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&running] {
      const tessel_point point = somePoint();
      for (int sent = 0; sent < kEach;) sent += tessel_event(&point) == 0;
      --running;
    });
  }
  size_t received = 0;
  while (running > 0) received += journal.take().size();
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(received + journal.take().size(), size_t{kThreads} * kEach);
  EXPECT_EQ(traceSockets().size(), 1u);
}

TEST_F(TraceDelivery, UnitsOfOneProgramShareSocketAndSwitch) {
  const tessel_point point = somePoint();
  EXPECT_EQ(tessel_event(&point), 0);
  EXPECT_EQ(record_from_second_unit(), 0);
  EXPECT_EQ(traceSockets().size(), 1u);
  tessel_enable(false);
  EXPECT_EQ(record_from_second_unit(), 0);
  EXPECT_EQ(tessel_event(&point), 0);
  tessel_enable(true);
  EXPECT_EQ(journal.take().size(), 2u);
}

TEST_F(TraceDelivery, DisabledAtCompileTimeDoesNothing) {
  EXPECT_FALSE(enabled_while_disabled());
  EXPECT_EQ(record_while_disabled(), 0);
  EXPECT_TRUE(journal.take().empty());
}

TEST_F(TraceDelivery, TheEnvironmentSwitchesItOff) {
  const std::string command = std::string(TRACE_RECORDER) + " 3 > /dev/null";
  ASSERT_EQ(std::system(("TESSEL_TRACE=0 " + command).c_str()), 0);
  EXPECT_TRUE(journal.take().empty());
  ASSERT_EQ(std::system(("TESSEL_TRACE=1 " + command).c_str()), 0);
  EXPECT_EQ(journal.take().size(), 5u);
}

}  // namespace
