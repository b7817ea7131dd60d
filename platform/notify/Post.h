#pragma once

// Posting a notification and reading how many posts there have been.

#include <cstdint>
#include <string_view>

#include "platform/value/Result.h"

namespace notify {

// Posts the notification name: creates its directory (0755) and file (0644)
// when missing, and adds one to its count, written as one fixed-width record
// with a single pwrite. Never waits on a lock another user can take: posts
// of this process's threads are serialised by a private mutex, and posts of
// the poster's processes by an flock on ".<name>.lock", a 0600 file of the
// poster's own that no other user can open. So every post counts exactly
// once. Returns the count after this post. Errors: InvalidName, or
// FileSystem naming the file (for example when it belongs to another user).
tn::Result<uint64_t> post(std::string_view name);

// The number of posts of name so far: 0 when its file does not exist or
// does not hold a number. Takes no lock: reads until two reads agree.
// Creates nothing. Errors: InvalidName, or
// FileSystem naming the file.
tn::Result<uint64_t> postCount(std::string_view name);

}  // namespace notify
