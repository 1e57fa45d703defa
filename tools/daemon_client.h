// A connection to the running zorvnotifyd daemon over its Unix socket, which
// speaks newline-delimited JSON both ways.  Reads are bounded: a line longer
// than kMaxLine bytes ends the connection instead of growing a buffer.
#ifndef ZORVNOTIFYD_TOOLS_DAEMON_CLIENT_H_
#define ZORVNOTIFYD_TOOLS_DAEMON_CLIENT_H_

#include <cstddef>
#include <string>

namespace zorvnotifyctl {

class DaemonClient {
 public:
  // The longest line accepted from the daemon, newline excluded.
  static constexpr size_t kMaxLine = 1024 * 1024;

  enum class Read {
    kLine,     // |line| holds the next line
    kTimeout,  // nothing came in time
    kClosed,   // the daemon closed the connection (a partial last line is dropped)
    kFailed,   // a read failed or a line was too long; |error| says which
  };

  DaemonClient() = default;
  ~DaemonClient();
  DaemonClient(const DaemonClient&) = delete;
  DaemonClient& operator=(const DaemonClient&) = delete;

  // Connects to the socket at |path| and checks that root serves it (the
  // daemon runs as root; anyone else's socket is an impostor's).  On
  // failure returns false with |error| a message for the user; it starts
  // with "zorvnotifyd is not running" when no daemon listens there (no
  // socket, or a stale one).
  bool Connect(const std::string& path, std::string* error);

  // Sends |line| and a newline, all of it (never raises SIGPIPE).
  bool Send(const std::string& line, std::string* error);

  // Waits for the next whole line, at most |timeout_ms| ms (negative: no
  // limit).
  Read ReadLine(std::string* line, int timeout_ms, std::string* error);

 private:
  int fd_ = -1;
  std::string in_;  // received bytes not yet returned; below kMaxLine + one chunk
};

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_DAEMON_CLIENT_H_
