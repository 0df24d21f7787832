// Writers: who wrote the trace points of a run, what each writer holds, and what he lost.
//
// A writer is a user, and within the user a program. The user is the owner of the session that the
// entry came from, or else the user of the process: user namespaces hand out many users to one
// owner. The program is the path of the executable. The journal daemon says all of this, so no
// writer can pass for another user. But a user can give his program any path, so within one user a
// path proves little.
//
// The daemon can name neither owner nor executable of a process that has ended before it looked.
// Such a process could be of any of the users that one owner hands out, thousands of them. So all
// entries without both count for one user, the unknown one. The price: honest programs that live
// only for a moment share that user, and a flood of such programs costs them their trace points.
//
// Threads: one at a time.

#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/FlatIndex.h"
#include "platform/Losses.h"
#include "platform/Values.h"
#include "trace/TracePointTable.h"

namespace tessel {

// By what the journal daemon says. Either may be absent: it is then a writer called "unknown".
struct Origin {
  std::optional<uint32_t> user;
  StringRef image;
};

// The writer of an entry. A session has one owner, however many users its namespaces hand out. The
// daemon looks up owner and executable of a living process alike. So if there is an executable but
// no owner, the process belongs to no session, as a system service, and its user counts.
inline Origin writerOf(const TracePointTable& table, const PointTokens& tokens) {
  const FieldToken image = tokenOf(tokens, FieldKind::imagePath);
  auto user = table.user(tokenOf(tokens, FieldKind::sessionOwner));
  if (!user && image != kNoToken) user = table.user(tokenOf(tokens, FieldKind::user));
  return {user, table.text(image)};
}

// A user can make any number of programs, so writers are bounded. A writer takes 100 bytes and at
// most 256 for its name, so all of them stay under 4 MiB. One user may take a thirty-second part of
// the programs. A program beyond a limit counts as "other" of its user, and a user beyond a limit
// as "other" altogether.
struct WriterLimits {
  size_t users = 1024;
  size_t programs = 8192;
  size_t programsOfAUser = 256;
};

class Writers {
 public:
  explicit Writers(WriterLimits limits = {}) : limits_(limits) {}

  // The number of the writer. Writers are numbered from 0 as they come, and never leave.
  uint32_t numberOf(const Origin& origin);
  uint32_t userOf(uint32_t writer) const { return writers_[writer].user; }
  // The writer's place among the writers of his user, from 0.
  uint32_t placeOf(uint32_t writer) const { return writers_[writer].place; }
  uint32_t at(uint32_t user, uint32_t place) const { return users_[user].writers[place]; }
  size_t size() const { return writers_.size(); }
  size_t users() const { return users_.size(); }

  // Notes that the writer lost something. REQUIRES: isOfWriter(code).
  void lost(uint32_t writer, LossCode code, uint64_t count = 1);
  uint64_t lostOf(LossCode code) const { return sums_[indexOf(code)]; }
  // Adds a loss for each writer who lost something, most first.
  void addLosses(Losses& losses) const;

 private:
  static constexpr size_t kFirstCode = static_cast<size_t>(LossCode::lostAtSource);
  static constexpr size_t kCodes = static_cast<size_t>(LossCode::beyondTimeLimit) - kFirstCode + 1;
  static constexpr uint32_t kNone = FlatIndex::kNone;
  using Counts = std::array<uint64_t, kCodes>;  // by indexOf()

  struct User {
    uint64_t key;
    std::vector<uint32_t> writers;
    uint32_t other = kNone;  // the writer of all programs beyond the limit
  };
  struct Writer {
    uint32_t user;
    uint32_t place;
    uint64_t image;    // hash of the path
    std::string name;  // of the program, for people: shortened
    Counts lost{};
  };

  // No user has a number over 32 bits, so these two are nobody's.
  static constexpr uint64_t kUnknownUser = uint64_t{1} << 32;
  static constexpr uint64_t kOtherUsers = kUnknownUser + 1;

  static uint64_t keyOf(std::optional<uint32_t> user) {
    return user ? uint64_t{*user} : kUnknownUser;
  }
  static size_t indexOf(LossCode code) { return static_cast<size_t>(code) - kFirstCode; }
  uint32_t userNumber(uint64_t key);
  uint32_t add(uint32_t user, uint64_t image, std::string name);
  LossPlace placeFor(const Writer& writer) const;
  void addLosses(LossCode code, Losses& losses) const;

  const WriterLimits limits_;
  std::vector<User> users_;
  std::vector<Writer> writers_;
  FlatIndex userIndex_;    // of users_, by key
  FlatIndex writerIndex_;  // of writers_, by user and image; without those called "other"
  Counts sums_{};
};

// Ranking: numbered holders with an amount each, and who has most. A binary heap that knows the
// place of each holder, so a change costs a few comparisons and finding the first costs none.
class Ranking {
 public:
  void set(uint32_t holder, uint64_t amount);
  uint64_t amountOf(uint32_t holder) const {
    return holder < amounts_.size() ? amounts_[holder] : 0;
  }
  bool empty() const { return heap_.empty(); }
  // REQUIRES: not empty().
  uint32_t first() const { return heap_.front(); }

 private:
  bool above(uint32_t a, uint32_t b) const { return amounts_[a] > amounts_[b]; }
  void put(size_t place, uint32_t holder);

  std::vector<uint64_t> amounts_;  // by holder
  std::vector<uint32_t> places_;   // by holder: its place in heap_
  std::vector<uint32_t> heap_;     // holders; none is above the one at half its place
};

// Holdings: what each writer holds of one thing that can be taken back, and who holds most of it:
// the user who holds most, and among his programs the one that holds most. On nearly all days
// nobody asks for it, so the writers are ranked only from the first question on.
class Holdings {
 public:
  explicit Holdings(const Writers& writers) : writers_(writers) {}

  // REQUIRES: no writer comes to hold less than nothing.
  void change(uint32_t writer, int64_t by) {
    if (held_.size() <= writer) [[unlikely]]
      held_.resize(writer + 1);
    held_[writer] += static_cast<uint64_t>(by);  // unsigned arithmetic also takes away
    total_ += static_cast<uint64_t>(by);
    if (ranked_) [[unlikely]]
      rank(writer, by);
  }
  uint64_t total() const { return total_; }
  // REQUIRES: total() is not 0.
  uint32_t greatest();

 private:
  void rank(uint32_t writer, int64_t by);

  const Writers& writers_;
  std::vector<uint64_t> held_;  // by writer
  uint64_t total_ = 0;
  bool ranked_ = false;
  Ranking users_;
  std::vector<Ranking> programs_;  // by user
};

}  // namespace tessel
