// Any fields in any entries, decoded and assembled. The limits on memory are so low that inputs
// reach all of them.
//
// A line of the input is a field, and an empty line ends an entry. The first byte of an entry moves
// the clock and picks the boot.

#include <cstdint>
#include <cstdlib>
#include <string_view>
#include <vector>

#include "trace/IntervalAssembler.h"
#include "trace/TracePointTable.h"

namespace {

using namespace tessel;

// Keeps the last objects and reads them later: their strings must outlive the entry they came from.
class KeepingSink final : public TraceObjectSink {
 public:
  explicit KeepingSink(Writers& writers)
      : shares_(writers,
                {.pairs = 16, .pairBytes = 256, .images = 16, .imageBytes = 256, .counters = 16}),
        losses_(writers, [this](const Origin& one) { return shares_.admitsCounter(one); }) {}
  bool admits(const ObjectOffer& offer) override {
    if (!offer.subsystem() || !offer.category()) std::abort();
    return shares_.admits(offer);
  }
  void addTold(const ToldLosses& told) override { losses_.add(told); }
  void deliverEvent(std::shared_ptr<const TesselEvent> event) override { keep(std::move(event)); }
  void deliverInterval(std::shared_ptr<const TesselInterval> interval) override {
    interval->attribute("BundleIdOverride");
    keep(std::move(interval));
  }
  void deliverAnimationInterval(std::shared_ptr<const TesselAnimationInterval> interval) override {
    keep(std::move(interval));
  }

 private:
  void keep(std::shared_ptr<const TesselObject> object) {
    auto& old = kept_[next_++ % std::size(kept_)];
    if (old && old->name().hash() != (old->name() ? hashText(old->name().text()) : 0)) std::abort();
    old = std::move(object);
  }
  Shares shares_;
  SourceLosses losses_;
  std::shared_ptr<const TesselObject> kept_[16];
  size_t next_ = 0;
};

std::string_view takeLine(std::string_view& rest) {
  const std::string_view line = rest.substr(0, rest.find('\n'));
  rest.remove_prefix(std::min(rest.size(), line.size() + 1));
  return line;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::string_view rest(reinterpret_cast<const char*>(data), size);
  TracePointTable table({.fields = 48, .textBytes = size_t{32} << 10});
  Writers writers({.users = 2, .programs = 6, .programsOfAUser = 3});
  KeepingSink sink(writers);
  IntervalAssembler assembler(table, writers, sink, {.intervals = 8, .attributes = 12});
  EntryHeader header;
  while (!rest.empty()) {
    header.monotonic += static_cast<uint8_t>(rest.front());
    header.bootId[0] = rest.front() & 1;
    std::vector<FieldToken> tokens;
    for (std::string_view line = takeLine(rest); !line.empty(); line = takeLine(rest)) {
      const std::string_view name = line.substr(0, line.find('='));
      if (name.size() == line.size()) continue;
      const std::string_view value = line.substr(name.size() + 1);
      const FieldToken token =
          table.tokenFor(name, value.substr(0, kMaxFieldValueLength + 1), value.size());
      if (token != kNoToken) tokens.push_back(token);
    }
    assembler.consume({header, tokens});
  }
  const AssemblyCounts counts = assembler.counts();
  const uint64_t begins = counts.pairedEnds + counts.replacedBegins + counts.droppedOpenIntervals +
                          counts.openIntervals;
  const uint64_t ends = counts.pairedEnds + counts.unmatchedEnds;
  if (counts.tracePoints != counts.events + begins + ends) std::abort();
  if (counts.openIntervals > 8) std::abort();
  return 0;
}
