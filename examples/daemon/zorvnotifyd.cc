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

#include <cstdio>
#include <string>

#include "catalogue.h"
#include "report.h"
#include "unique_fd.h"
#include "watch_tree.h"

namespace zorvnotifyd {
namespace {

const char kUsage[] =
    "Usage: zorvnotifyd [--json] [--help]\n"
    "\n"
    "Watches, with inotify, every directory tree that a monitor queue of the catalogue\n"
    "names and writes one line on standard output for every queue that wants an event.\n"
    "With --json the line is a JSON object with the keys \"queue\", \"type\" (share, etc or\n"
    "local-etc), \"file\", \"path\" and \"mask\" (the inotify IN_* bits of the event).\n"
    "\n"
    "The daemon runs in the foreground and never forks: start it from a service\n"
    "manager (see zorvnotifyd.service for systemd).  It needs root.  It reloads the\n"
    "catalogue when a queue file changes and stops on SIGTERM or SIGINT (status 0).\n"
    "Log lines go to syslog and to standard error.\n";

constexpr int kMissingRootRetryMs = 5000;

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
int Serve(bool json) {
  UniqueFd signals = OpenSignals();
  CatalogueWatch catalogue_watch;
  UniqueFd inotify = OpenInotify();
  if (signals.get() < 0 || inotify.get() < 0 || !catalogue_watch.Open()) return 1;
  Catalogue catalogue = LoadCatalogue();
  WatchTree tree(std::move(inotify));
  if (!tree.Sync(WatchRoots(catalogue))) return 1;
  syslog(LOG_INFO, "ready: watching %zu directories for %zu queues", tree.size(), catalogue.size());
  const EventSink report = [&](const std::string& path, uint32_t mask) {
    ReportEvent(catalogue, path, mask, json);
  };
  struct pollfd fds[] = {
      {signals.get(), POLLIN, 0}, {tree.fd(), POLLIN, 0}, {catalogue_watch.fd(), POLLIN, 0}};
  for (;;) {
    // A configured tree that does not exist (yet) is looked for again every
    // few seconds, so that a share mounted or created later gets watched.
    const int ready = poll(fds, 3, tree.missing_roots() ? kMissingRootRetryMs : -1);
    if (ready < 0) {
      if (errno == EINTR) continue;
      syslog(LOG_ERR, "poll failed: %s", strerror(errno));
      return 1;
    }
    if (ready == 0) {
      tree.Sync(WatchRoots(catalogue));
      continue;
    }
    struct signalfd_siginfo info;
    if ((fds[0].revents & POLLIN) && read(signals.get(), &info, sizeof(info)) == sizeof(info)) {
      syslog(LOG_INFO, "stopping on %s: releasing %zu watches", strsignal(int(info.ssi_signo)),
             tree.size());
      tree.Clear();
      return 0;
    }
    if ((fds[1].revents & POLLIN) && !tree.ReadEvents(report)) return 1;
    if (ferror(stdout)) {
      syslog(LOG_ERR, "cannot write the report to standard output: stopping");
      tree.Clear();
      return 1;
    }
    if ((fds[2].revents & POLLIN) && catalogue_watch.ReadChanges()) {
      catalogue = LoadCatalogue();
      tree.Sync(WatchRoots(catalogue));
      syslog(LOG_INFO, "catalogue reloaded: watching %zu directories for %zu queues", tree.size(),
             catalogue.size());
    }
  }
}

}  // namespace
}  // namespace zorvnotifyd

int main(int argc, char** argv) {
  bool json = false;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    if (arg == "--help" || arg == "-h") {
      fputs(zorvnotifyd::kUsage, stdout);
      return 0;
    }
    if (arg != "--json") {
      fprintf(stderr, "zorvnotifyd: unknown argument \"%s\" (see --help)\n", argv[i]);
      return 2;
    }
    json = true;
  }
  // A reader of the report that goes away (zorvnotifyd | head) ends the
  // daemon through a write error, not by a signal that skips the clean-up.
  signal(SIGPIPE, SIG_IGN);
  openlog("zorvnotifyd", LOG_PID | LOG_PERROR, LOG_DAEMON);
  if (geteuid() != 0) {
    syslog(LOG_ERR, "must run as root: the catalogue and the watched trees are root's");
    return 1;
  }
  const int status = zorvnotifyd::Serve(json);
  closelog();
  return status;
}
