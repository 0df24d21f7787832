// FakeJournal: a socket in the place of the journal's. It parses the datagrams that it receives,
// and sets TESSEL_JOURNAL_SOCKET to its path. For one thread at a time.

#pragma once

#include <string>
#include <utility>
#include <vector>

struct JournalEntry {
  std::vector<std::pair<std::string, std::string>> fields;  // in the order of the datagram
  bool wasFile = false;                                     // came as a memory file
  int seals = 0;                                            // of that file

  static constexpr const char* kNone = "(none)";
  // The first value of a field; kNone where there is none.
  std::string operator[](const std::string& name) const;
};

class FakeJournal {
 public:
  FakeJournal();
  ~FakeJournal();
  FakeJournal(const FakeJournal&) = delete;
  FakeJournal& operator=(const FakeJournal&) = delete;

  // The entries that arrived since the last call.
  std::vector<JournalEntry> take();
  // stop() removes the socket, as a daemon that ends; start() makes a new one.
  void stop();
  void start();

 private:
  std::string directory_;
  std::string path_;
  int fd_ = -1;
};
