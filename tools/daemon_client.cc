// The connection to zorvnotifyd.

#include "daemon_client.h"

#include <errno.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <cstring>

#include "text.h"

namespace zorvnotifyctl {

DaemonClient::~DaemonClient() {
  if (fd_ >= 0) close(fd_);
}

bool DaemonClient::Connect(const std::string& path, std::string* error) {
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof(address.sun_path)) {
    *error = "socket path " + zorvcommon::Quoted(path) + " is empty or too long";
    return false;
  }
  path.copy(address.sun_path, path.size());
  fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd_ < 0) {
    *error = std::string("cannot create a socket: ") + strerror(errno);
    return false;
  }
  const std::string shown = zorvcommon::Printable(path);
  if (connect(fd_, reinterpret_cast<struct sockaddr*>(&address), sizeof(address)) == 0) {
    // Whoever could make the socket file answers here: only root's socket
    // is the daemon's, and nothing it says is trusted before that is known.
    struct ucred peer = {};
    socklen_t size = sizeof(peer);
    if (getsockopt(fd_, SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0) {
      *error = "cannot tell who serves the socket at " + shown + ": " + strerror(errno);
    } else if (peer.uid != 0) {
      *error = "refusing the socket at " + shown + ": it is served by uid " +
               std::to_string(peer.uid) + " (pid " + std::to_string(peer.pid) +
               "), not by root, so it is not zorvnotifyd's";
    } else {
      return true;
    }
    close(fd_);
    fd_ = -1;
    return false;
  }
  const int failure = errno;
  close(fd_);
  fd_ = -1;
  if (failure == ENOENT || failure == ENOTDIR) {
    *error = "zorvnotifyd is not running (no socket at " + shown + ")";
  } else if (failure == ECONNREFUSED) {
    *error = "zorvnotifyd is not running (nothing listens on " + shown + ")";
  } else if (failure == EACCES || failure == EPERM) {
    *error = "permission denied: cannot connect to " + shown +
             " (zorvnotifyd serves root, and the members of its group when it has one)";
  } else {
    *error = "cannot connect to " + shown + ": " + strerror(failure);
  }
  return false;
}

bool DaemonClient::Send(const std::string& line, std::string* error) {
  const std::string text = line + '\n';
  for (size_t sent = 0; sent < text.size();) {
    const ssize_t n = send(fd_, text.data() + sent, text.size() - sent, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      *error = std::string("cannot send the request to zorvnotifyd: ") + strerror(errno);
      return false;
    }
    sent += static_cast<size_t>(n);
  }
  return true;
}

DaemonClient::Read DaemonClient::ReadLine(std::string* line, int timeout_ms, std::string* error) {
  using Clock = std::chrono::steady_clock;
  const Clock::time_point deadline = Clock::now() + std::chrono::milliseconds(timeout_ms);
  for (;;) {
    const size_t end = in_.find('\n');
    if (end != std::string::npos) {
      line->assign(in_, 0, end);
      in_.erase(0, end + 1);
      return Read::kLine;
    }
    if (in_.size() > kMaxLine) {
      *error = "zorvnotifyd sent a line longer than " + std::to_string(kMaxLine) + " bytes";
      return Read::kFailed;
    }
    int wait = -1;
    if (timeout_ms >= 0) {
      const auto left =
          std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
      wait = static_cast<int>(left > 0 ? left : 0);
    }
    struct pollfd fds = {fd_, POLLIN, 0};
    const int ready = poll(&fds, 1, wait);
    if (ready < 0 && errno == EINTR) continue;
    if (ready < 0) {
      *error = std::string("cannot wait for zorvnotifyd: ") + strerror(errno);
      return Read::kFailed;
    }
    if (ready == 0) {
      *error = "zorvnotifyd did not answer in time";
      return Read::kTimeout;
    }
    char chunk[64 * 1024];
    const ssize_t n = recv(fd_, chunk, sizeof(chunk), 0);
    if (n < 0 && errno == EINTR) continue;
    if (n == 0 || (n < 0 && errno == ECONNRESET)) return Read::kClosed;
    if (n < 0) {
      *error = std::string("cannot read from zorvnotifyd: ") + strerror(errno);
      return Read::kFailed;
    }
    in_.append(chunk, static_cast<size_t>(n));
  }
}

}  // namespace zorvnotifyctl
