#include "notify.h"

#include <stddef.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "unique_fd.h"

namespace zorvnotifyd {

using zorvcommon::UniqueFd;

bool NotifyServiceManager(const std::string& state) {
  const char* name = getenv("NOTIFY_SOCKET");
  if (name == nullptr || name[0] == '\0') return false;
  const size_t length = strlen(name);
  struct sockaddr_un address;
  memset(&address, 0, sizeof(address));
  address.sun_family = AF_UNIX;
  // A path needs room for its terminating NUL; an abstract name does not
  // have one (its leading '@' stands for the NUL byte that marks it).
  if ((name[0] != '/' && name[0] != '@') || length + (name[0] == '/') > sizeof(address.sun_path)) {
    return false;
  }
  memcpy(address.sun_path, name, length);
  if (name[0] == '@') address.sun_path[0] = '\0';
  const socklen_t address_length = socklen_t(offsetof(struct sockaddr_un, sun_path) + length);
  UniqueFd fd(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  if (fd.get() < 0) return false;
  // The kernel adds the sender's credentials when the receiver asks for
  // them, which is how the service manager checks NotifyAccess=main.
  return sendto(fd.get(), state.data(), state.size(), MSG_NOSIGNAL,
                reinterpret_cast<const struct sockaddr*>(&address),
                address_length) == ssize_t(state.size());
}

bool StderrIsJournal() {
  const char* stream = getenv("JOURNAL_STREAM");
  uintmax_t device = 0, inode = 0;
  struct stat st;
  return stream != nullptr && sscanf(stream, "%ju:%ju", &device, &inode) == 2 &&
         fstat(STDERR_FILENO, &st) == 0 && uintmax_t(st.st_dev) == device &&
         uintmax_t(st.st_ino) == inode;
}

}  // namespace zorvnotifyd
