// Follows a queue through the zorvnotifyd daemon and prints each of its
// events, one a line: "#SEQ KIND PATH MASK", the bytes of a path that are
// not printable ASCII as \xXY.  The subscription reconnects by itself when
// the daemon restarts and goes on after the last event printed.
//
//   follower [--socket PATH] [--since SEQ] [--for SECONDS] QUEUE
//
// With --since it starts after record SEQ of the queue's journal (0: every
// record the journal still holds) instead of from now on.
//
// Exits 1 when it cannot subscribe (no daemon, a socket not served by
// root), 0 after SECONDS; without --for it runs until it is stopped.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <string>

#include <monitor_queue_subscription.h>

using ZORV::ZORVNOTIFYD::MonitorQueueEvent;
using ZORV::ZORVNOTIFYD::MonitorQueueSubscription;

// |text| with every byte that is not printable ASCII (and the backslash)
// as \xXY, so that no name can forge a line or move the terminal.
static std::string Escaped(const std::string& text) {
  std::string out;
  for (const unsigned char c : text) {
    if (c >= 0x20 && c < 0x7f && c != '\\') {
      out += char(c);
    } else {
      char hex[5];
      std::snprintf(hex, sizeof(hex), "\\x%02x", c);
      out += hex;
    }
  }
  return out;
}

int main(int argc, char** argv) {
  std::string socket = "/run/zorvnotifyd/zorvnotifyd.sock";
  long seconds = -1;
  long long since = -1;
  int i = 1;
  for (; i + 1 < argc && argv[i][0] == '-'; i += 2) {
    if (std::strcmp(argv[i], "--socket") == 0) {
      socket = argv[i + 1];
    } else if (std::strcmp(argv[i], "--since") == 0) {
      since = std::atoll(argv[i + 1]);
    } else if (std::strcmp(argv[i], "--for") == 0) {
      seconds = std::atol(argv[i + 1]);
    } else {
      break;
    }
  }
  if (i + 1 != argc) {
    std::fprintf(stderr, "usage: follower [--socket PATH] [--since SEQ] [--for SECONDS] QUEUE\n");
    return 2;
  }
  MonitorQueueSubscription subscription(socket);
  const bool subscribed = since < 0 ? subscription.Subscribe(argv[i])
                                    : subscription.Subscribe(argv[i], uint64_t(since));
  if (!subscribed) {
    std::fprintf(stderr, "follower: %s\n", Escaped(subscription.LastError()).c_str());
    return 1;
  }
  static const char* const kKinds[] = {"event",      "lost",   "removed",
                                       "registered", "missed", "rescan"};
  const time_t end = seconds < 0 ? 0 : std::time(nullptr) + seconds;
  MonitorQueueEvent event;
  while (seconds < 0 || std::time(nullptr) < end) {
    if (!subscription.Next(event, 1000)) continue;  // a time-out: look at the clock
    if (event._kind == MonitorQueueEvent::MISSED) {
      std::printf("missed %llu\n", static_cast<unsigned long long>(event._missed));
    } else {
      std::printf("#%llu %s %s %u%s\n", static_cast<unsigned long long>(event._seq),
                  kKinds[event._kind], Escaped(event._path).c_str(), event._mask,
                  event._offline ? " offline" : "");
    }
    std::fflush(stdout);
  }
  return 0;
}
