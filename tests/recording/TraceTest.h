// The fixture of the tests of trace.h: a fake journal, and a look at this program's sockets to it.

#pragma once

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "FakeJournal.h"
#include "tessel/trace.h"

class TraceTest : public ::testing::Test {
 protected:
  // Each test makes another journal, so a socket to the previous one must be closed. What earlier
  // tests lost must not stand in the entries of this one.
  void SetUp() override {
    closeTraceSockets();
    tessel_state_v2_.lost = tessel_state_v2_.told = 0;
    tessel_state_v2_.since = tessel_state_v2_.stuck = 0;
  }

  // Records until the journal has no room, without a wait, and then `further` more. Answers how
  // many were taken.
  size_t fill(uint64_t further = 0) {
    tessel_point point = somePoint();
    point.no_wait = true;
    size_t taken = 0;
    while (taken < 100'000 && tessel_event(&point) == 0) ++taken;
    for (uint64_t i = 1; i < further; ++i) EXPECT_EQ(tessel_event(&point), EAGAIN);
    return taken;
  }

  static tessel_point somePoint() {
    tessel_point point{};
    point.subsystem = "com.vantor.Calendar";
    point.category = "View";
    point.name = "Open";
    return point;
  }

  // Descriptors of this process that are connected to a fake journal, of this test or an old one.
  static std::vector<int> traceSockets() {
    std::vector<int> found;
    for (int fd = 3; fd < 256; ++fd) {
      sockaddr_un address{};
      socklen_t size = sizeof address;
      if (getpeername(fd, reinterpret_cast<sockaddr*>(&address), &size) != 0) continue;
      if (std::string(address.sun_path).find("tessel-journal") != std::string::npos) {
        found.push_back(fd);
      }
    }
    return found;
  }
  static void closeTraceSockets() {
    for (const int fd : traceSockets()) close(fd);
  }

  JournalEntry only() {
    std::vector<JournalEntry> entries = journal.take();
    EXPECT_EQ(entries.size(), 1u);
    return entries.empty() ? JournalEntry{} : entries.front();
  }

  FakeJournal journal;
};
