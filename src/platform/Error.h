// PlatformError: how something outside of this program failed. Programs decide by the code; people
// read the words.
//
// A plain value; any thread.

#pragma once

#include <cerrno>
#include <cstdint>
#include <string>

namespace tessel {

enum class ErrorCode : uint8_t {
  failed,     // none of the others
  notFound,   // no such file or directory
  noAccess,   // it is there, but this user may not read or write it
  notAStore,  // it can be read, but nothing in it is a journal
};

constexpr ErrorCode codeOf(int error) {
  switch (error) {
    case ENOENT:
    case ENOTDIR:
      return ErrorCode::notFound;
    case EACCES:
    case EPERM:
    case EROFS:
      return ErrorCode::noAccess;
    default:
      return ErrorCode::failed;
  }
}

struct PlatformError {
  ErrorCode code = ErrorCode::failed;
  std::string words;  // one sentence; it names the path that failed
};

}  // namespace tessel
