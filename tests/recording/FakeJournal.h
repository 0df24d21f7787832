// FakeJournal: stands where the journal's socket would be and takes datagrams apart. It names
// itself in TESSEL_JOURNAL_SOCKET. One thread at a time.

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

  // What has arrived since the last call.
  std::vector<JournalEntry> take();
  // Takes the socket away, as a daemon that ends; and puts up a new one.
  void stop();
  void start();

 private:
  std::string directory_;
  std::string path_;
  int fd_ = -1;
};
