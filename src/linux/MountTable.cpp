// Reading mountinfo.

#include "linux/MountTable.h"

#include <fstream>
#include <sstream>

namespace tessel {

namespace {

bool isOctal(char digit) { return digit >= '0' && digit <= '7'; }

// The kernel writes blanks and backslashes in a field as \ooo.
std::string unescaped(std::string_view field) {
  std::string out;
  for (size_t i = 0; i < field.size(); ++i) {
    if (field[i] == '\\' && i + 3 < field.size() && isOctal(field[i + 1]) &&
        isOctal(field[i + 2]) && isOctal(field[i + 3])) {
      out += static_cast<char>((field[i + 1] - '0') * 64 + (field[i + 2] - '0') * 8 +
                               (field[i + 3] - '0'));
      i += 3;
    } else {
      out += field[i];
    }
  }
  return out;
}

// The type of the file system in one line, where that is mounted at "/". A line reads
//   id parent device root MOUNT-POINT options [optional...] - TYPE source options
std::optional<std::string> typeAtRoot(const std::string& line) {
  std::istringstream fields(line);
  std::string field;
  for (int i = 0; i < 5; ++i) fields >> field;
  if (!fields || unescaped(field) != "/") return {};
  while (fields >> field && field != "-") {
  }
  if (!(fields >> field)) return {};
  return unescaped(field);
}

}  // namespace

std::optional<std::string> MountTable::rootFilesystemTypeName() {
  std::ifstream table(path_);
  std::optional<std::string> type;
  for (std::string line; std::getline(table, line);) {
    if (auto found = typeAtRoot(line)) type = std::move(found);
  }
  return type;
}

}  // namespace tessel
