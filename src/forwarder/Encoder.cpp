// The list of output formats, the facts of this machine, the identifiers of records, and the
// cutting of a batch.
//
// An identifier is a keyed hash of a row's content. The spool's id and the row's number would be
// shorter, but a spool that is restored from a backup uses its numbers again for other rows, and a
// backend that keeps one record per identifier then loses half of them. Their common part would
// also join all records of a machine for ever. The price of the hash: a row that somebody edits in
// the spool after it was sent counts as another one.

#include "forwarder/Encoder.h"

#include <sys/utsname.h>
#include <systemd/sd-id128.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <iterator>
#include <limits>
#include <utility>

#include "linux/SystemFacts.h"
#include "os/Files.h"
#include "platform/Invariant.h"
#include "platform/Text.h"
#include "statora/HealthLedger.h"

namespace tessel {

// Each format needs this declaration and an entry in kFormats. A header would say no more.
extern const OutputFormat kOtlpProtobuf;
extern const OutputFormat kOtlpJson;
extern const OutputFormat kNdjson;

namespace {

constexpr const OutputFormat* kFormats[] = {&kOtlpProtobuf, &kOtlpJson, &kNdjson};

constexpr size_t kMaxOsReleaseBytes = size_t{64} << 10;

// OpenTelemetry's names for processor architectures differ from the kernel's. A name that is not in
// the table goes out as the kernel writes it.
std::string architectureName() {
  constexpr std::pair<std::string_view, const char*> kNames[] = {
      {"x86_64", "amd64"},  {"aarch64", "arm64"}, {"i686", "x86"},
      {"i586", "x86"},      {"armv7l", "arm32"},  {"armv6l", "arm32"},
      {"ppc64le", "ppc64"}, {"ppc64", "ppc64"},   {"s390x", "s390x"},
  };
  utsname kernel{};
  if (uname(&kernel) != 0) return {};
  for (const auto& [machine, name] : kNames) {
    if (machine == kernel.machine) return name;
  }
  return kernel.machine;
}

// A number that stands for one purpose. systemd hashes it together with the machine id, so nobody
// can connect what we make for two purposes. A container may have no machine id: then it is absent.
std::optional<sd_id128_t> machineIdFor(const sd_id128_t& purpose) {
  sd_id128_t id{};
  if (sd_id128_get_machine_app_specific(purpose, &id) < 0) return {};
  return id;
}

std::string instanceId() {
  constexpr sd_id128_t kPurpose{{0x6b, 0x1d, 0x0a, 0x5c, 0x9e, 0x3f, 0x4f, 0x0c, 0x8b, 0x61, 0xd2,
                                 0x77, 0x3a, 0x90, 0xe4, 0x15}};
  const auto id = machineIdFor(kPurpose);
  char text[SD_ID128_UUID_STRING_MAX];
  return id ? sd_id128_to_uuid_string(*id, text) : "";
}

// Names that say which machine it is. Everything below "host." counts but for what describes a kind
// of machine, so that a convention of tomorrow is withheld.
constexpr std::string_view kMachineNames[] = {
    "service.instance.id", "host",          "hostname",     "instance",       "device.id",
    "cloud.resource_id",   "faas.instance", "container.id", "container.name", "server.address",
};
constexpr std::string_view kMachinePrefixes[] = {"host.", "k8s.node.", "k8s.pod.", "net.host.",
                                                 "aws.ecs.task."};
constexpr std::string_view kMachineKinds[] = {"host.arch", "host.type", "host.image."};

// A length goes before each text, so that no two rows give the same bytes.
void appendWord(std::string& bytes, uint64_t word) {
  for (size_t i = 0; i < sizeof word; ++i) bytes += static_cast<char>(word >> (8 * i));
}

constexpr int64_t kLastSecond = 253'402'300'799;  // of the year 9999

}  // namespace

std::span<const OutputFormat* const> outputFormats() { return kFormats; }

bool namesMachine(std::string_view attribute) {
  std::string name(attribute);
  // Keys have no fixed case, and a capital letter must not give a machine away.
  for (char& letter : name) {
    if (letter >= 'A' && letter <= 'Z') letter = static_cast<char>(letter - 'A' + 'a');
  }
  const auto begins = [&](std::string_view prefix) { return name.starts_with(prefix); };
  if (std::ranges::any_of(kMachineKinds, begins)) return false;
  return std::ranges::find(kMachineNames, name) != std::end(kMachineNames) ||
         std::ranges::any_of(kMachinePrefixes, begins);
}

Resources readResources(const std::string& osReleasePath, const ResourceAttributes& given,
                        bool rowsNameMachine) {
  const std::string text = readSmallFile(osReleasePath, kMaxOsReleaseBytes).value_or("");
  ResourceAttributes all{
      {"service.name", "tessel_reporter"},
      {"service.version", TESSEL_VERSION},
      {"service.instance.id", instanceId()},
      {"os.type", "linux"},
      {"os.name", std::string(osReleaseValue(text, "NAME"))},
      {"os.version", std::string(osReleaseValue(text, "VERSION_ID"))},
      {"host.arch", architectureName()},
  };
  for (const auto& [name, value] : given) {
    const auto same = std::ranges::find(all, name, &ResourceAttributes::value_type::first);
    if (same == all.end()) {
      all.emplace_back(name, value);
    } else {
      same->second = value;
    }
  }
  // The os-release file may hold anything, and one text that is not UTF-8 makes receivers refuse
  // the whole request.
  for (auto& attribute : all) attribute.second = replaceInvalidUtf8(attribute.second);
  // An unknown fact is left out: an empty text would look like a fact.
  std::erase_if(all, [](const auto& attribute) { return attribute.second.empty(); });
  Resources resources{all, all};
  if (!rowsNameMachine) {
    std::erase_if(resources.ofRows, [](const auto& one) { return namesMachine(one.first); });
  }
  return resources;
}

bool isHealth(const SpooledEvent& event) { return event.name == kHealthEvent; }

std::vector<RecordGroup> groupByResource(std::span<const OutgoingRecord> records,
                                         const std::array<std::string, 2>& resources) {
  std::vector<RecordGroup> groups;
  for (const bool health : {false, true}) {
    RecordGroup group{resources[health ? 1 : 0], {}};
    for (const OutgoingRecord& record : records) {
      if (isHealth(record.event) == health) group.records.push_back(&record);
    }
    if (!group.records.empty()) groups.push_back(std::move(group));
  }
  return groups;
}

RecordIds::RecordIds(std::string_view spoolId, std::string_view machine)
    // The inner hash makes a key of any text, and mixes the machine's secret into it.
    : key_(sipHash128(machine, sipHash128(spoolId, {}))) {}

RecordIds RecordIds::ofThisMachine(std::string_view spoolId) {
  constexpr sd_id128_t kPurpose{{0x2e, 0x95, 0x7c, 0x14, 0xf0, 0x0b, 0x47, 0x8d, 0xa3, 0x5a, 0x61,
                                 0xc9, 0x08, 0xbe, 0x42, 0x77}};
  const auto id = machineIdFor(kPurpose);
  if (!id) return {spoolId, {}};
  return {spoolId, {reinterpret_cast<const char*>(id->bytes), sizeof id->bytes}};
}

std::string RecordIds::of(const SpooledEvent& event) const {
  std::string bytes;
  bytes.reserve(event.name.size() + event.payload.size() + 3 * sizeof(uint64_t));
  appendWord(bytes, static_cast<uint64_t>(event.id));
  appendWord(bytes, static_cast<uint64_t>(event.time));
  appendWord(bytes, event.name.size());
  bytes.append(event.name).append(event.payload);
  constexpr char kDigits[] = "0123456789abcdef";
  std::string text;
  for (const uint8_t byte : sipHash128(bytes, key_)) {
    text += kDigits[byte >> 4];
    text += kDigits[byte & 15];
  }
  return text;
}

uint64_t nanosecondsOf(int64_t microseconds) {
  // Many backends keep the number with a sign, so the largest is that of 63 bits: the year 2262.
  constexpr int64_t kLast = std::numeric_limits<int64_t>::max() / 1000;
  return static_cast<uint64_t>(std::clamp(microseconds, int64_t{0}, kLast)) * 1000;
}

std::string utcText(int64_t microseconds) {
  using namespace std::chrono;
  const int64_t inRange = std::clamp(microseconds, int64_t{0}, kLastSecond * 1'000'000);
  const sys_time<std::chrono::microseconds> time{std::chrono::microseconds{inRange}};
  const auto day = floor<days>(time);
  const year_month_day date{day};
  const hh_mm_ss clock{time - day};
  char text[32];
  const int length = std::snprintf(
      text, sizeof text, "%04d-%02u-%02uT%02d:%02d:%02d.%06dZ", int{date.year()},
      unsigned{date.month()}, unsigned{date.day()}, static_cast<int>(clock.hours().count()),
      static_cast<int>(clock.minutes().count()), static_cast<int>(clock.seconds().count()),
      static_cast<int>(clock.subseconds().count()));
  return {text, static_cast<size_t>(length)};
}

Batch cutBatch(std::vector<SpooledEvent> events, const Encoder& encoder, std::string_view spoolId,
               size_t maxBytes) {
  Batch batch;
  batch.records.reserve(events.size());
  size_t bytes = 0;
  const RecordIds ids = RecordIds::ofThisMachine(spoolId);
  for (SpooledEvent& event : events) {
    auto text = encoder.record(event, ids.of(event));
    if (text) {
      // One byte more, for the comma between two records.
      bytes += text->size() + 1;
      if (bytes > maxBytes && !batch.records.empty()) break;
    }
    batch.lastId = event.id;
    if (text) {
      batch.records.push_back({std::move(event), std::move(*text)});
    } else {
      batch.malformed.push_back(std::move(event));
    }
  }
  // A batch without a row would make the forwarder ask for the same rows for ever.
  TESSEL_INVARIANT(!batch.records.empty() || !batch.malformed.empty());
  return batch;
}

}  // namespace tessel
