// ServiceUser: what the service's user may do with a file.
//
// Root may read nearly everything, so what root sees says nothing about the service. Asked by root,
// a child process becomes the service's user and tries. Stateless; one thread at a time.

#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

namespace tessel::ctl {

// The owner of the state directory. Without one, the user that the package makes, or else the user
// who asks.
uid_t serviceUser(const std::string& stateDirectory);

// 0 if the user may, else the errno of the refusal. Absent if that cannot be found out: only root
// can ask for another user.
std::optional<int> tryToRead(uid_t user, const std::string& path);
// For a directory: whether the user may make and replace files in it.
std::optional<int> tryToChange(uid_t user, const std::string& directory);

}  // namespace tessel::ctl
