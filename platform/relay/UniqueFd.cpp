#include "platform/relay/UniqueFd.h"

#include <unistd.h>

namespace relay {

void UniqueFd::reset(int fd) {
  if (fd_ >= 0) ::close(fd_);
  fd_ = fd;
}

}  // namespace relay
