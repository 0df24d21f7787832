#include "journal/JournalSocket.h"

#include <sys/uio.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <system_error>

namespace tessel {

namespace {

constexpr const char* kSocket = "/run/systemd/journal/socket";

PlatformError failure(int error) {
  return {codeOf(error), std::string("Cannot write to the journal at ") + kSocket + ": " +
                             std::generic_category().message(error)};
}

}  // namespace

std::optional<PlatformError> sendToJournal(const std::vector<RecordedField>& fields) {
  // The library answers success where there is no daemon.
  if (::access(kSocket, W_OK) != 0) return failure(errno);
  std::vector<std::string> texts;
  texts.reserve(fields.size());
  for (const RecordedField& field : fields) texts.push_back(field.name + "=" + field.value);
  std::vector<iovec> parts;
  parts.reserve(fields.size());
  for (std::string& text : texts) parts.push_back({text.data(), text.size()});
  const int result = ::sd_journal_sendv(parts.data(), static_cast<int>(parts.size()));
  if (result < 0) return failure(-result);
  return std::nullopt;
}

}  // namespace tessel
