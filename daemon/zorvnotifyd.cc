// zorvnotifyd: reports file changes to the monitor queues of the catalogue
// that want them.  Runs in the foreground until SIGTERM or SIGINT.
//
// Exit status: 0 stopped by a signal, 1 could not start or could not go on,
// 2 bad command line.

#include <errno.h>
#include <poll.h>
#include <signal.h>
#include <string.h>
#include <sys/signalfd.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <string>

#include "catalogue.h"
#include "report.h"
#include "unique_fd.h"
#include "watch_tree.h"

namespace zorvnotifyd {
namespace {

const char kUsage[] =
    "Usage: zorvnotifyd [--json] [--retry SECONDS] [--version] [--help]\n"
    "\n"
    "Watches, with inotify, every directory tree that a monitor queue of the catalogue\n"
    "names and writes one line on standard output for every queue that wants an event.\n"
    "With --json the line is a JSON object with the keys \"queue\", \"type\" (share, etc or\n"
    "local-etc), \"file\", \"path\" and \"mask\" (the inotify IN_* bits of the event).\n"
    "\n"
    "  --json           JSON lines instead of readable ones\n"
    "  --retry SECONDS  how often trees that are missing, replaced or over the watch\n"
    "                   limit are looked at again (default 5; fractions allowed)\n"
    "  --version        print the version and exit\n"
    "\n"
    "The daemon runs in the foreground and never forks: start it from a service\n"
    "manager (zorvnotifyd.service for systemd).  It needs root.  It reloads the\n"
    "catalogue when a queue file changes and stops on SIGTERM or SIGINT (status 0).\n"
    "Log lines go to syslog and to standard error.  See zorvnotifyd(8).\n";

constexpr double kDefaultRetrySeconds = 5;

// Milliseconds of CLOCK_MONOTONIC.
int64_t NowMs() {
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return int64_t(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

// Blocks SIGTERM and SIGINT and returns a descriptor that reads them, or an
// empty one (logged).
UniqueFd OpenSignals() {
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGTERM);
  sigaddset(&signals, SIGINT);
  if (sigprocmask(SIG_BLOCK, &signals, nullptr) != 0) {
    syslog(LOG_ERR, "cannot block SIGTERM and SIGINT: %s", strerror(errno));
    return UniqueFd();
  }
  UniqueFd fd(signalfd(-1, &signals, SFD_NONBLOCK | SFD_CLOEXEC));
  if (fd.get() < 0) syslog(LOG_ERR, "cannot open a signalfd: %s", strerror(errno));
  return fd;
}

// Serves events until a stop signal (returns 0) or a fatal error (1).
int Serve(bool json, double retry_seconds) {
  UniqueFd signals = OpenSignals();
  CatalogueWatch catalogue_watch;
  UniqueFd inotify = OpenInotify();
  if (signals.get() < 0 || inotify.get() < 0 || !catalogue_watch.Open()) return 1;
  CatalogueLoader loader;
  Reporter reporter(json);
  WatchTree tree(std::move(inotify), retry_seconds);
  // Reads the catalogue, and makes the report and the watches follow it.
  auto load = [&] {
    Catalogue catalogue = loader.Load();
    const std::vector<std::string> roots = loader.Honour(&catalogue);
    reporter.Use(std::move(catalogue));
    tree.Sync(roots, reporter.index());
  };
  load();
  syslog(LOG_INFO, "ready: watching %zu directories for %zu queues", tree.size(), reporter.size());
  const int64_t retry_ms = std::max<int64_t>(1, int64_t(retry_seconds * 1000));
  int64_t next_tick = NowMs() + retry_ms;
  struct pollfd fds[] = {
      {signals.get(), POLLIN, 0}, {tree.fd(), POLLIN, 0}, {catalogue_watch.fd(), POLLIN, 0}};
  for (;;) {
    // Trees that went away, were replaced or did not fit under the watch
    // limit are looked at again on a fixed period, whatever the load.
    const int ready = poll(fds, 3, int(std::max<int64_t>(0, next_tick - NowMs())));
    if (ready < 0 && errno != EINTR) {
      syslog(LOG_ERR, "poll failed: %s", strerror(errno));
      return 1;
    }
    struct signalfd_siginfo info;
    if (ready > 0 && (fds[0].revents & POLLIN) &&
        read(signals.get(), &info, sizeof(info)) == sizeof(info)) {
      syslog(LOG_INFO, "stopping on %s: releasing %zu watches", strsignal(int(info.ssi_signo)),
             tree.size());
      tree.Clear();
      return 0;
    }
    if (ready > 0 && (fds[1].revents & POLLIN) && !tree.ReadEvents(reporter)) return 1;
    if (ready > 0 && (fds[2].revents & POLLIN) && catalogue_watch.ReadChanges()) {
      load();
      syslog(LOG_INFO, "catalogue reloaded: watching %zu directories for %zu queues", tree.size(),
             reporter.size());
    }
    if (NowMs() >= next_tick) {
      tree.Tick(reporter);
      next_tick = NowMs() + retry_ms;
    }
    if (fflush(stdout) != 0 || ferror(stdout)) {
      syslog(LOG_ERR, "cannot write the report to standard output: stopping");
      tree.Clear();
      return 1;
    }
  }
}

}  // namespace
}  // namespace zorvnotifyd

int main(int argc, char** argv) {
  bool json = false;
  double retry_seconds = zorvnotifyd::kDefaultRetrySeconds;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    if (arg == "--help" || arg == "-h") {
      fputs(zorvnotifyd::kUsage, stdout);
      return 0;
    }
    if (arg == "--version") {
      printf("zorvnotifyd %s\n", ZORVNOTIFYD_VERSION_STRING);
      return 0;
    }
    if (arg == "--json") {
      json = true;
      continue;
    }
    if (arg == "--retry" && i + 1 < argc) {
      char* end = nullptr;
      retry_seconds = strtod(argv[++i], &end);
      if (*end == '\0' && retry_seconds >= 0.001 && retry_seconds <= 86400) continue;
      fprintf(stderr, "zorvnotifyd: --retry takes a number of seconds from 0.001 to 86400\n");
      return 2;
    }
    fprintf(stderr, "zorvnotifyd: unknown argument \"%s\" (see --help)\n", argv[i]);
    return 2;
  }
  // A reader of the report that goes away (zorvnotifyd | head) ends the
  // daemon through a write error, not by a signal that skips the clean-up.
  signal(SIGPIPE, SIG_IGN);
  openlog("zorvnotifyd", LOG_PID | LOG_PERROR, LOG_DAEMON);
  if (geteuid() != 0) {
    syslog(LOG_ERR, "must run as root: the catalogue and the watched trees are root's");
    return 1;
  }
  const int status = zorvnotifyd::Serve(json, retry_seconds);
  closelog();
  return status;
}
