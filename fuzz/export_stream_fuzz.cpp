// Any bytes as a file in the Journal Export Format. The reader must come to an end, and must go on
// when the file has grown by a good entry, as a file that is being written does.

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>

#include "journal/ExportEntryStream.h"
#include "trace/TracePointTable.h"

namespace {

void append(int file, const void* data, size_t size) {
  if (::pwrite(file, data, size, ::lseek(file, 0, SEEK_END)) != static_cast<ssize_t>(size))
    std::abort();
}

void readAll(tessel::ExportEntryStream& stream, tessel::TracePointTable& table) {
  while (stream.next()) {
    for (const tessel::FieldToken token : stream.entry().tokens) {
      if (table.kind(token) == tessel::FieldKind::name && table.text(token).text().size() > 4096)
        std::abort();
    }
    if (table.full()) table.startGeneration();
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const int file = ::memfd_create("export", 0);
  if (::ftruncate(file, 0) != 0) std::abort();
  append(file, data, size);
  // Opened anew: a duplicate descriptor would share the read position with ours.
  const std::string path = "/proc/self/fd/" + std::to_string(file);
  tessel::TracePointTable table({.fields = 64, .textBytes = size_t{64} << 10});
  tessel::StopFlag stop = false;
  tessel::FileReport report;
  tessel::WindowBudget windows;
  tessel::ExportReadResources resources{windows};
  tessel::ExportEntryStream stream(::open(path.c_str(), O_RDONLY), resources, table, stop, report);
  readAll(stream, table);
  constexpr std::string_view kGood = "\n\n__REALTIME_TIMESTAMP=1\nTESSEL_NAME=x\n\n";
  append(file, kGood.data(), kGood.size());
  readAll(stream, table);
  return 0;
}
