// The list of output formats, the facts of this machine, and the cutting of a batch.

#include "forwarder/Encoder.h"

#include <sys/utsname.h>
#include <systemd/sd-id128.h>

#include <iterator>
#include <utility>

#include "linux/SystemFacts.h"
#include "os/Files.h"
#include "platform/Invariant.h"

namespace tessel {

// Each format needs this declaration and an entry in kFormats. A header would say no more.
extern const OutputFormat kOtlpJson;

namespace {

constexpr const OutputFormat* kFormats[] = {&kOtlpJson};

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

std::optional<std::string> instanceId() {
  // A random number that stands for this program. systemd hashes it together with the machine id.
  // So two programs on one machine have identifiers that nobody can connect.
  constexpr sd_id128_t kApplication{{0x6b, 0x1d, 0x0a, 0x5c, 0x9e, 0x3f, 0x4f, 0x0c, 0x8b, 0x61,
                                     0xd2, 0x77, 0x3a, 0x90, 0xe4, 0x15}};
  sd_id128_t id{};
  // A container without a machine id has no instance id either.
  if (sd_id128_get_machine_app_specific(kApplication, &id) < 0) return {};
  char text[SD_ID128_UUID_STRING_MAX];
  return sd_id128_to_uuid_string(id, text);
}

}  // namespace

std::span<const OutputFormat* const> outputFormats() { return kFormats; }

ResourceFacts readResourceFacts(const std::string& osReleasePath, bool withInstanceId) {
  const std::string text = readSmallFile(osReleasePath, kMaxOsReleaseBytes).value_or("");
  return {TESSEL_VERSION, std::string(osReleaseValue(text, "NAME")),
          std::string(osReleaseValue(text, "VERSION_ID")), architectureName(),
          withInstanceId ? instanceId() : std::nullopt};
}

Batch cutBatch(std::vector<SpooledEvent> events, const Encoder& encoder, std::string_view spoolId,
               size_t maxBytes) {
  Batch batch;
  batch.records.reserve(events.size());
  size_t bytes = 0;
  for (SpooledEvent& event : events) {
    auto text = encoder.record(event, spoolId);
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
