// zorvnotifyd: delivers file changes to the programs that subscribed to
// the monitor queues that want them.  Runs in the foreground until SIGTERM
// or SIGINT.
//
// Exit status: 0 stopped by a signal, 1 could not start or could not go on,
// 2 bad command line.

#include <errno.h>
#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <signal.h>
#include <string.h>
#include <sys/resource.h>
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
#include "journal_dir.h"
#include "json_writer.h"
#include "notify.h"
#include "queue_log.h"
#include "report.h"
#include "server.h"
#include "snapshot.h"
#include "state_dir.h"
#include "sync_timer.h"
#include "text.h"
#include "unique_fd.h"
#include "watch_tree.h"
#include "watchers.h"

namespace zorvnotifyd {

using zorvcommon::UniqueFd;
namespace {

const char kUsage[] =
    "Usage: zorvnotifyd [OPTION]...\n"
    "\n"
    "Watches, with inotify or fanotify, every directory tree that a monitor queue of\n"
    "the catalogue names, and delivers each queue's events to the programs that\n"
    "subscribe to it on the daemon's Unix socket, as JSON lines (see zorvnotifyd(8)\n"
    "for the protocol).\n"
    "\n"
    "  --socket PATH         the socket (default /run/zorvnotifyd/zorvnotifyd.sock), in\n"
    "                        a directory of root's that only root may write\n"
    "  --state-dir DIR       what is kept across restarts (default /var/lib/zorvnotifyd),\n"
    "                        a directory of root's that only root may write\n"
    "  --group GROUP         members of GROUP may connect too (default: root only)\n"
    "  --keep N              records kept in memory per queue (default 100); older\n"
    "                        ones are read back from the queue's journal\n"
    "  --journal-size BYTES  journal kept per queue (default 8388608: the last 4 to\n"
    "                        8 MiB of records; 0: none, records in memory only)\n"
    "  --sync-interval MS    records reach the disk at most this long after they\n"
    "                        are written (default 100)\n"
    "  --snapshot-interval MS\n"
    "                        the directories events marked are listed again for\n"
    "                        the snapshot at most this often (default 1000)\n"
    "  --coalesce US         when events are ready, wait this many microseconds more\n"
    "                        for those that follow, so that they are handled and\n"
    "                        sent together (default 5000; 0 to 100000; 0: read\n"
    "                        at once)\n"
    "  --client-buffer BYTES output a client may have waiting (default 262144)\n"
    "  --max-clients N       clients served at once (default 1000)\n"
    "  --stdout              also write one line per queue and event on standard output\n"
    "  --json                ... as JSON objects (implies --stdout)\n"
    "  --retry SECONDS       how often trees that are missing, replaced or over the\n"
    "                        watch limit are looked at again (default 5; fractions allowed)\n"
    "  --backend auto|inotify|fanotify\n"
    "                        what watches the trees (default auto: fanotify for a\n"
    "                        tree that is a whole mounted file system where the\n"
    "                        kernel, the file system and CAP_SYS_ADMIN allow it,\n"
    "                        inotify elsewhere)\n"
    "  --version             print the version and exit\n"
    "\n"
    "The daemon runs in the foreground and never forks: start it from a service\n"
    "manager (zorvnotifyd.service for systemd, which it tells when it is ready).  It\n"
    "needs root.  It reloads the catalogue when a queue file changes or on SIGHUP,\n"
    "and stops on SIGTERM or SIGINT (status 0).  Log lines go to syslog and to standard error.\n";

constexpr double kDefaultRetrySeconds = 5;
constexpr int64_t kDefaultCoalesceUs = 5000;

// Descriptors kept from the clients for everything else: about 16 that the
// daemon holds or opens for a moment (standard streams, syslog, the
// signalfd, two inotify instances, home, the listener, epoll, a queue
// file, the name service for --group, a refused client), and the rest for
// a directory walk, which holds one descriptor per level of the directory
// it is in: a tree about 100 levels deep is walked whole with every client
// connected.
constexpr size_t kReservedDescriptors = 128;

// Makes the descriptor limit cover |max_clients| clients and the reserve,
// raising the soft limit toward the hard one if need be.  Returns how many
// clients fit: |max_clients|, or fewer (logged) when the limit stays lower.
size_t FitDescriptorLimit(size_t max_clients) {
  const rlim_t wanted = rlim_t(max_clients + kReservedDescriptors);
  struct rlimit limit;
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0) return max_clients;  // cannot happen
  if (limit.rlim_cur != RLIM_INFINITY && limit.rlim_cur < wanted) {
    struct rlimit raised = limit;
    raised.rlim_cur = limit.rlim_max == RLIM_INFINITY ? wanted : std::min(wanted, limit.rlim_max);
    if (raised.rlim_cur > limit.rlim_cur && setrlimit(RLIMIT_NOFILE, &raised) == 0) limit = raised;
  }
  if (limit.rlim_cur == RLIM_INFINITY || limit.rlim_cur >= wanted) return max_clients;
  const size_t fit =
      limit.rlim_cur > kReservedDescriptors ? size_t(limit.rlim_cur - kReservedDescriptors) : 1;
  syslog(LOG_WARNING,
         "the descriptor limit (%llu) leaves room for %zu clients, not the %zu of --max-clients "
         "(%zu more are kept for the trees and the daemon): serving at most %zu; raise the "
         "limit (LimitNOFILE=) to %zu",
         (unsigned long long)limit.rlim_cur, fit, max_clients, kReservedDescriptors, fit,
         max_clients + kReservedDescriptors);
  return fit;
}

// Milliseconds of CLOCK_MONOTONIC.
int64_t NowMs() {
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return int64_t(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

// Blocks SIGTERM, SIGINT and SIGHUP and returns a descriptor that reads
// them, or an empty one (logged).  SIGHUP asks for a reload: left to its
// default action it would end the daemon with a status that a service
// manager counts as a clean exit, so nothing would start it again.
UniqueFd OpenSignals() {
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGTERM);
  sigaddset(&signals, SIGINT);
  sigaddset(&signals, SIGHUP);
  if (sigprocmask(SIG_BLOCK, &signals, nullptr) != 0) {
    syslog(LOG_ERR, "cannot block SIGTERM, SIGINT and SIGHUP: %s", strerror(errno));
    return UniqueFd();
  }
  UniqueFd fd(signalfd(-1, &signals, SFD_NONBLOCK | SFD_CLOEXEC));
  if (fd.get() < 0) syslog(LOG_ERR, "cannot open a signalfd: %s", strerror(errno));
  return fd;
}

// Compares the trees that the start's walk watched with what was saved of
// them, after READY: a start is ready once its watches are in place, and
// the changes found are numbered before any event that came meanwhile.
void CompareAfterReady(Watchers& tree) {
  const int64_t start = NowMs();
  const size_t trees = tree.Compare();
  if (trees > 0) {
    syslog(LOG_INFO, "compared %zu trees with their snapshot in %lld ms", trees,
           (long long)(NowMs() - start));
  }
}

// READY=1 with the status line the service manager shows for the daemon.
std::string ReadyState(size_t directories, size_t queues) {
  return "READY=1\nSTATUS=watching " + std::to_string(directories) + " directories for " +
         std::to_string(queues) + " queues";
}

struct Options {
  ServerOptions server;
  Stdout out = Stdout::kNone;
  double retry_seconds = kDefaultRetrySeconds;
  size_t keep = 100;
  std::string state_dir = kDefaultStateDir;
  uint64_t journal_size = 8 << 20;
  int64_t sync_interval_ms = 100;
  int64_t snapshot_interval_ms = 1000;
  int64_t coalesce_us = kDefaultCoalesceUs;
  Backend backend = Backend::kAuto;
};

// Before a turn reads events: waits |window_us| for those that follow the
// one that woke the loop.  A change is several events (a file's creation,
// writes and close come within microseconds), so one turn then reads,
// records, journals and sends them together: one wake-up of the daemon and
// of each client, not one per event.  Under a flood each turn finds more
// waiting, so the cost per event only falls; a stop signal or a client
// waits at most the window longer.
void Coalesce(int64_t window_us) {
  if (window_us <= 0) return;
  struct timespec wait = {time_t(window_us / 1000000), long(window_us % 1000000) * 1000};
  // The signals that matter are blocked (read from the signalfd): nothing
  // interrupts the wait but a stop and continue of the process.
  while (nanosleep(&wait, &wait) != 0 && errno == EINTR) {
  }
}

// The snapshot directory's second descriptor, for the fanotify watcher's
// own snapshot; empty (no snapshot kept) when it cannot be had.
UniqueFd DupDescriptor(int fd) { return UniqueFd(fd < 0 ? -1 : fcntl(fd, F_DUPFD_CLOEXEC, 0)); }

// Serves events until a stop signal (returns 0) or a fatal error (1).
int Serve(const Options& options) {
  UniqueFd signals = OpenSignals();
  CatalogueWatch catalogue_watch;
  UniqueFd inotify = OpenInotify();
  if (signals.get() < 0 || inotify.get() < 0 || !catalogue_watch.Open()) return 1;
  StateDir state;
  if (!state.Open(options.state_dir)) return 1;
  JournalDir journals;
  // --journal-size 0: records in memory only, a new journal id each start.
  const bool journaling = options.journal_size > 0 ? journals.Open(state) : false;
  CatalogueLoader loader;
  QueueLogs logs(options.keep);
  logs.set_journal_id(journals.id().empty() ? RandomId() : journals.id());
  if (journaling) {
    logs.UseJournals(journals.fd(), options.journal_size, BootId(),
                     [&journals] { return journals.Renew(); });
  }
  SyncTimer sync(options.sync_interval_ms);
  Reporter reporter(logs, options.out);
  Watchers tree(std::move(inotify), options.retry_seconds, options.backend);
  std::string reason;
  UniqueFd snapshot_dir = state.OpenSubdirectory("snapshot", &reason);
  if (snapshot_dir.get() < 0) {
    syslog(LOG_ERR, "cannot keep the snapshot of the trees (%s): every tree is rescanned",
           reason.c_str());
  }
  Snapshot fanotify_snapshot(DupDescriptor(snapshot_dir.get()));
  Snapshot snapshot(std::move(snapshot_dir));
  tree.UseSnapshots(&snapshot, &fanotify_snapshot, &reporter);
  // The snapshot never gets ahead of the journals.  A change seen by the
  // listing had its event queued by then, so every queued event is read
  // and its records written and synced before the listing is saved: a
  // crash at any moment leaves each change in a journal, or still to be
  // found by comparing with the older snapshot.  Under a flood that does
  // not let the queue empty, the snapshot waits for a later sync.
  //
  // Listing the marked directories is most of a sync's cost under a steady
  // load, so it is done at most every --snapshot-interval; the journals
  // are synced every time, and at the stop both.
  int64_t next_listing_ms = 0;
  bool stopping = false;
  sync.Join([&] {
    const int64_t now = NowMs();
    if (!stopping && now < next_listing_ms) {
      logs.WriteOut();
      logs.Sync();
      // A sync is due again when the listing is, events or not.
      if (snapshot.pending() || fanotify_snapshot.pending()) sync.Wrote(next_listing_ms);
      return;
    }
    next_listing_ms = now + options.snapshot_interval_ms;
    tree.Relist();
    const bool drained = tree.Drain(reporter);
    logs.WriteOut();
    logs.Sync();
    if (drained) tree.SaveSnapshot();
  });
  Server server(options.server, logs, RandomId(), [&] {
    std::string status;
    AppendJsonNumber(&status, "directories", tree.size());
    status += ',';
    AppendJsonNumber(&status, "queues", reporter.size());
    status += ',';
    AppendJsonNumber(&status, "events", reporter.events());
    status += ',';
    AppendJsonNumber(&status, "overflows", reporter.overflows());
    status += ',';
    AppendJsonNumber(&status, "trees_missing", tree.missing());
    status += ',';
    AppendJsonNumber(&status, "directories_over_watch_limit", tree.over_limit());
    status += ',';
    tree.AppendStatus(&status);
    status += ',';
    AppendJsonField(&status, "state",
                    !journaling       ? "no journal"
                    : logs.degraded() ? "degraded"
                                      : "ok");
    status += ',';
    logs.AppendStatus(&status);
    return status;
  });
  if (!server.Listen()) return 1;
  reporter.OnRecord([&server](QueueLog* log) { server.Recorded(log); });
  logs.OnRecord([&server](QueueLog* log) { server.Recorded(log); });
  // Reads the catalogue, and makes the records and the watches follow it;
  // returns the logs of the queues new to the daemon.
  auto load = [&] {
    Catalogue catalogue = loader.Load();
    std::vector<std::string> roots = loader.Honour(&catalogue);
    std::vector<QueueLog*> created;
    reporter.Use(std::move(catalogue), &created);
    tree.Sync(std::move(roots), reporter.masks());
    return created;
  };
  // Opens the new queues' journals, makes the index over the queues and
  // makes the clients' subscriptions follow the catalogue.
  auto follow = [&](const std::vector<QueueLog*>& created) {
    logs.Opened();
    reporter.BuildIndex();
    server.FollowNew(created);
  };
  tree.CompareLater();
  const std::vector<QueueLog*> created = load();
  syslog(LOG_INFO, "ready: watching %zu directories for %zu queues", tree.size(), reporter.size());
  NotifyServiceManager(ReadyState(tree.size(), reporter.size()));
  // Once the watches are in place no change goes unseen: the journals are
  // opened and the index made after, before any client is served or any
  // event read (a record made meanwhile opens and makes them first).
  follow(created);
  tree.LogChoices();
  CompareAfterReady(tree);
  sync.Wrote(NowMs());  // the views of the trees compared
  const int64_t retry_ms = std::max<int64_t>(1, int64_t(options.retry_seconds * 1000));
  int64_t next_tick = NowMs() + retry_ms;
  struct pollfd fds[] = {{signals.get(), POLLIN, 0},
                         {tree.inotify_fd(), POLLIN, 0},
                         {catalogue_watch.fd(), POLLIN, 0},
                         {server.fd(), POLLIN, 0},
                         {tree.fanotify_fd(), POLLIN, 0}};
  for (;;) {
    // Trees that went away, were replaced or did not fit under the watch
    // limit are looked at again on a fixed period, whatever the load.
    const int64_t wake = sync.due() >= 0 ? std::min(next_tick, sync.due()) : next_tick;
    fds[4].fd = tree.fanotify_fd();  // opened by the first load, or never
    const int timeout = tree.walking() ? 0 : int(std::max<int64_t>(0, wake - NowMs()));
    const int ready = poll(fds, 5, timeout);
    if (ready < 0 && errno != EINTR) {
      syslog(LOG_ERR, "poll failed: %s", strerror(errno));
      return 1;
    }
    struct signalfd_siginfo info;
    uint32_t signal_number = 0;
    if (ready > 0 && (fds[0].revents & POLLIN) &&
        read(signals.get(), &info, sizeof(info)) == sizeof(info)) {
      signal_number = info.ssi_signo;
    }
    const bool hangup = signal_number == SIGHUP;
    if (hangup) syslog(LOG_INFO, "reloading the catalogue on SIGHUP");
    if (signal_number != 0 && !hangup) {
      NotifyServiceManager("STOPPING=1");
      syslog(LOG_INFO, "stopping on %s: releasing %zu watches", strsignal(int(info.ssi_signo)),
             tree.size());
      // The snapshot is saved with the last sync, while the watches still
      // tell which directories are the ones watched.
      logs.WriteOut();
      stopping = true;
      sync.Run(NowMs());
      tree.Clear();
      logs.Close();
      return 0;
    }
    const bool inotify_ready = ready > 0 && (fds[1].revents & POLLIN);
    const bool fanotify_ready = ready > 0 && (fds[4].revents & POLLIN);
    if (inotify_ready || fanotify_ready) Coalesce(options.coalesce_us);
    if (inotify_ready) {
      if (!tree.ReadInotify(reporter)) return 1;
      sync.Wrote(NowMs());  // the directories the events marked
    }
    if (fanotify_ready) {
      if (!tree.ReadFanotify(reporter)) return 1;
      sync.Wrote(NowMs());
    }
    // Trees that fanotify serves are compared with the snapshot after
    // ready, a hundred directories a turn, events read in between.
    if (tree.walking()) {
      tree.WalkPending();
      sync.Wrote(NowMs());
    }
    // A configuration directory that was missing (a read-only /usr) and
    // exists now is read as soon as the next tick finds it.
    const bool tick = NowMs() >= next_tick;
    const bool changed = ready > 0 && (fds[2].revents & POLLIN) && catalogue_watch.ReadChanges();
    if (hangup || changed || (tick && catalogue_watch.WatchMissing())) {
      NotifyServiceManager("RELOADING=1");
      follow(load());
      tree.LogChoices();
      sync.Wrote(NowMs());
      syslog(LOG_INFO, "catalogue reloaded: watching %zu directories for %zu queues", tree.size(),
             reporter.size());
      NotifyServiceManager(ReadyState(tree.size(), reporter.size()));
    }
    if (ready > 0 && (fds[3].revents & POLLIN)) server.Handle();
    if (tick) {
      tree.Tick(reporter);
      server.Tick(options.retry_seconds);
      next_tick = NowMs() + retry_ms;
      sync.Wrote(NowMs());  // a tree that came back was compared
    }
    server.Deliver();
    // The journals' records of this turn, one write each, synced in groups;
    // a journal written again after a failure gives its queue rescan
    // records.
    logs.WriteOut();
    if (logs.unsynced()) sync.Wrote(NowMs());
    if (logs.Settle()) server.Deliver();
    // The group sync reads the events queued by then; their records go out
    // now, not with the next event or tick.
    if (sync.RunIfDue(NowMs())) server.Deliver();
    if (options.out != Stdout::kNone && (fflush(stdout) != 0 || ferror(stdout))) {
      syslog(LOG_ERR, "cannot write the report to standard output: stopping");
      tree.Clear();
      return 1;
    }
  }
}

// Parses |text| as a whole number from |min| to |max| into |value|.
bool ParseCount(const char* text, unsigned long long min, unsigned long long max,
                unsigned long long* value) {
  char* end = nullptr;
  errno = 0;
  *value = strtoull(text, &end, 10);
  return errno == 0 && end != text && *end == '\0' && text[0] != '-' && *value >= min &&
         *value <= max;
}

// Parses the command line into |options|; 0 to go on, otherwise the exit
// status (after --help or --version, or on an error, which it reports).
int ParseOptions(int argc, char** argv, Options* options) {
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    const char* value = i + 1 < argc ? argv[i + 1] : nullptr;
    unsigned long long number = 0;
    if (arg == "--help" || arg == "-h") {
      fputs(kUsage, stdout);
      return -1;
    } else if (arg == "--version") {
      printf("zorvnotifyd %s\n", ZORVNOTIFYD_VERSION_STRING);
      return -1;
    } else if (arg == "--json") {
      options->out = Stdout::kJson;
    } else if (arg == "--stdout") {
      if (options->out == Stdout::kNone) options->out = Stdout::kText;
    } else if (arg == "--socket" && value != nullptr) {
      options->server.socket_path = argv[++i];
    } else if (arg == "--state-dir" && value != nullptr) {
      options->state_dir = argv[++i];
    } else if (arg == "--group" && value != nullptr) {
      ++i;
      const struct group* group = getgrnam(value);
      if (group == nullptr && !ParseCount(value, 0, 0xfffffffe, &number)) {
        fprintf(stderr, "zorvnotifyd: no group \"%s\"\n", zorvcommon::Printable(value).c_str());
        return 2;
      }
      options->server.group_allowed = true;
      options->server.group = group != nullptr ? group->gr_gid : gid_t(number);
    } else if (arg == "--keep" && value != nullptr && ParseCount(value, 1, 1000000, &number)) {
      options->keep = size_t(number);
      ++i;
    } else if (arg == "--journal-size" && value != nullptr &&
               ParseCount(value, 0, 1ull << 40, &number) && (number == 0 || number >= 65536)) {
      options->journal_size = number;
      ++i;
    } else if (arg == "--sync-interval" && value != nullptr &&
               ParseCount(value, 1, 3600000, &number)) {
      options->sync_interval_ms = int64_t(number);
      ++i;
    } else if (arg == "--snapshot-interval" && value != nullptr &&
               ParseCount(value, 1, 3600000, &number)) {
      options->snapshot_interval_ms = int64_t(number);
      ++i;
    } else if (arg == "--coalesce" && value != nullptr && ParseCount(value, 0, 100000, &number)) {
      options->coalesce_us = int64_t(number);
      ++i;
    } else if (arg == "--client-buffer" && value != nullptr &&
               ParseCount(value, 1024, 1ull << 30, &number)) {
      options->server.client_buffer = size_t(number);
      ++i;
    } else if (arg == "--max-clients" && value != nullptr &&
               ParseCount(value, 1, 1000000, &number)) {
      options->server.max_clients = size_t(number);
      ++i;
    } else if (arg == "--backend" && value != nullptr && ParseBackend(value, &options->backend)) {
      ++i;
    } else if (arg == "--retry" && value != nullptr) {
      char* end = nullptr;
      options->retry_seconds = strtod(argv[++i], &end);
      if (*end != '\0' || !(options->retry_seconds >= 0.001 && options->retry_seconds <= 86400)) {
        fprintf(stderr, "zorvnotifyd: --retry takes a number of seconds from 0.001 to 86400\n");
        return 2;
      }
    } else {
      fprintf(stderr, "zorvnotifyd: bad argument \"%s\" (see --help)\n",
              zorvcommon::Printable(arg).c_str());
      return 2;
    }
  }
  return 0;
}

}  // namespace
}  // namespace zorvnotifyd

int main(int argc, char** argv) {
  zorvnotifyd::Options options;
  if (const int status = zorvnotifyd::ParseOptions(argc, argv, &options); status != 0) {
    return status < 0 ? 0 : status;
  }
  // A reader of the report that goes away (zorvnotifyd --stdout | head)
  // ends the daemon through a write error, not by a signal that skips the
  // clean-up; a client that goes away is a write error on its socket.
  signal(SIGPIPE, SIG_IGN);
  // On standard error too, for a person running it, unless that is the
  // journal syslog writes to as well.
  openlog("zorvnotifyd", LOG_PID | (zorvnotifyd::StderrIsJournal() ? 0 : LOG_PERROR), LOG_DAEMON);
  if (geteuid() != 0) {
    syslog(LOG_ERR, "must run as root: the catalogue and the watched trees are root's");
    return 1;
  }
  options.server.max_clients = zorvnotifyd::FitDescriptorLimit(options.server.max_clients);
  const int status = zorvnotifyd::Serve(options);
  closelog();
  return status;
}
