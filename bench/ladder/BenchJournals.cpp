#include "BenchJournals.h"

#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <random>
#include <stdexcept>

namespace tessel::bench {

namespace {

constexpr uint64_t kFirstMicrosecond = 1'795'300'000'000'000;
constexpr uint64_t kDayMicroseconds = 86'400'000'000;

class Writer {
 public:
  explicit Writer(const JournalSpec& spec) : spec_(spec) {}

  // Writes the entries of file `index` in the Journal Export Format.
  void writeFile(FILE* out, unsigned index) {
    const uint64_t first = spec_.entries * index / spec_.files;
    const uint64_t last = spec_.entries * (index + 1) / spec_.files;
    for (uint64_t i = first; i < last; ++i) writeEntry(out, i);
  }

 private:
  static constexpr unsigned kServices = 40;

  void writeEntry(FILE* out, uint64_t index);
  void writeOfMany(FILE* out, uint64_t index);
  void writePoint(FILE* out, uint64_t index, unsigned service);
  void writeLine(FILE* out, uint64_t index, unsigned service);
  unsigned below(unsigned limit) { return static_cast<unsigned>(random_() % limit); }

  const JournalSpec& spec_;
  std::mt19937 random_{42};
  uint64_t begins_ = 0;
  uint64_t ends_ = 0;
};

void Writer::writeEntry(FILE* out, uint64_t index) {
  const uint64_t offset = kDayMicroseconds / spec_.entries * index;
  const unsigned service = below(kServices);
  if (spec_.fewFields) {
    std::fprintf(out,
                 "__REALTIME_TIMESTAMP=%" PRIu64 "\n__MONOTONIC_TIMESTAMP=%" PRIu64
                 "\n_BOOT_ID=6c1f5a0e8d3b4f27a9e0c4d1b2f3a495\n_PID=%u\n_UID=1000\n"
                 "_EXE=/usr/lib/vantor/service%u\n",
                 kFirstMicrosecond + offset, 1'000'000 + offset, 1000 + service * 7, service);
    writeOfMany(out, index);
    std::fputs("\n", out);
    return;
  }
  std::fprintf(out,
               "__REALTIME_TIMESTAMP=%" PRIu64 "\n__MONOTONIC_TIMESTAMP=%" PRIu64
               "\n_BOOT_ID=6c1f5a0e8d3b4f27a9e0c4d1b2f3a495\n"
               "_MACHINE_ID=0f9e8d7c6b5a49382716059483726150\n_HOSTNAME=desk\n_TRANSPORT=journal\n"
               "_UID=1000\n_GID=1000\n_PID=%u\n_COMM=service%u\n_EXE=/usr/lib/vantor/service%u\n"
               "_SYSTEMD_UNIT=vantor-service%u.service\n_SYSTEMD_SLICE=user-1000.slice\n"
               "_SYSTEMD_CGROUP=/user.slice/vantor-service%u\n",
               kFirstMicrosecond + offset, 1'000'000 + offset, 1000 + service * 7, service, service,
               service, service);
  if (spec_.openIntervals != 0) {
    writeOfMany(out, index);
  } else if (index % spec_.onePointIn == 0) {
    writePoint(out, index, service);
  } else {
    writeLine(out, index, service);
  }
  std::fputs("\n", out);
}

// Half of the points are intervals: a begin, and two points later its end.
void Writer::writePoint(FILE* out, uint64_t index, unsigned service) {
  static constexpr const char* kKinds[] = {"event", "begin", "event", "end"};
  const uint64_t point = index / spec_.onePointIn;
  const char* kind = kKinds[point % 4];
  const uint64_t pair = point % 4 == 3 ? point - 2 : point;
  std::fprintf(out,
               "TESSEL_KIND=%s\nTESSEL_SUBSYSTEM=com.vantor.Service%" PRIu64
               "\nTESSEL_CATEGORY=Category%" PRIu64 "\nTESSEL_NAME=Operation%" PRIu64
               "\nTESSEL_TELEMETRY=1\nTESSEL_STRING1_NAME=state\nTESSEL_STRING1_VALUE=value%u\n",
               kind, pair % 20, pair % 7, pair % 50, below(30));
  if (point % 4 % 2 == 1)
    std::fprintf(out, "TESSEL_INTERVAL_SCOPE=system\nTESSEL_INTERVAL_ID=%" PRIu64 "\n", pair);
  else
    std::fprintf(out, "TESSEL_NUMBER1_NAME=count\nTESSEL_NUMBER1_VALUE=%u\n", below(1000));
  (void)service;
}

// Of eight entries two are lines, three events, and three begins or ends. While fewer than
// `openIntervals` are open, there are only begins.
void Writer::writeOfMany(FILE* out, uint64_t index) {
  if (!spec_.fewFields)
    std::fputs("SYSLOG_FACILITY=3\nCODE_FILE=src/main.c\nCODE_FUNC=run\nTHREAD=main\n", out);
  if (index % 4 == 0) {
    std::fprintf(out, "PRIORITY=6\nMESSAGE=handled request %" PRIu64 "\n", index);
    return;
  }
  const uint64_t point = index - index / 4;
  const bool event = point % 2 == 0;
  const bool end = !event && begins_ - ends_ >= spec_.openIntervals;
  const uint64_t id = event ? point : end ? ends_++ : begins_++;
  std::fprintf(out,
               "TESSEL_KIND=%s\nTESSEL_SUBSYSTEM=com.vantor.Service%" PRIu64
               "\nTESSEL_CATEGORY=Category%" PRIu64 "\nTESSEL_NAME=Operation\nTESSEL_TELEMETRY=1\n",
               event ? "event"
               : end ? "end"
                     : "begin",
               id % 20, id % 7);
  if (!event)
    std::fprintf(out, "TESSEL_INTERVAL_SCOPE=system\nTESSEL_INTERVAL_ID=%" PRIu64 "\n", id);
}

void Writer::writeLine(FILE* out, uint64_t index, unsigned service) {
  std::fprintf(out,
               "PRIORITY=6\nSYSLOG_FACILITY=3\nSYSLOG_IDENTIFIER=service%u\nCODE_FILE=src/main.c\n"
               "CODE_LINE=%u\nCODE_FUNC=handle_request\n_SOURCE_REALTIME_TIMESTAMP=%" PRIu64
               "\nMESSAGE=handled request %" PRIu64 " for client %u in %u ms\n",
               service, below(400), kFirstMicrosecond + index, index, below(1000), below(90));
}

}  // namespace

std::string makeJournals(const std::string& directory, const JournalSpec& spec) {
  std::string place = directory + "/" + spec.name;
  if (std::filesystem::exists(place + "/complete")) return place;
  std::filesystem::remove_all(place);
  std::filesystem::create_directories(place);
  Writer writer(spec);
  for (unsigned i = 0; i < spec.files; ++i) {
    char command[512];
    std::snprintf(command, sizeof command,
                  "SYSTEMD_JOURNAL_COMPACT=1 SYSTEMD_JOURNAL_KEYED_HASH=1 "
                  "/lib/systemd/systemd-journal-remote -o '%s/%03u.journal' - >/dev/null 2>&1",
                  place.c_str(), i);
    FILE* pipe = ::popen(command, "w");
    if (pipe == nullptr) throw std::runtime_error("systemd-journal-remote cannot be run");
    writer.writeFile(pipe, i);
    if (::pclose(pipe) != 0) throw std::runtime_error("systemd-journal-remote failed");
  }
  std::fclose(std::fopen((place + "/complete").c_str(), "w"));
  return place;
}

}  // namespace tessel::bench
