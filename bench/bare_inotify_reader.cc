// The baseline of the daemon benchmark: the least a program must do to get
// the events zorvnotifyd gets.  It reads lines "MASK PATH" from a file,
// watches every directory at or below each PATH with MASK (a walk with
// opendir and readdir, one inotify_add_watch per directory), says
// "ready N" (N watches) on standard output, and, given an event count,
// reads and counts events until that many have come.  No catalogue, no
// matching, no clients.
//
//   bare_inotify_reader ROOTS            watch, say "ready N", exit
//   bare_inotify_reader ROOTS EXPECTED   ... then read events until EXPECTED
//                                        have come, say "done COUNT OVERFLOWS"
//                                        and exit when standard input closes
//
// SIGUSR1 ends the reading early (events were lost): COUNT is then below
// EXPECTED.  The loop is one blocking read per buffer, nothing else.

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

namespace {

int g_inotify = -1;
unsigned long g_watches = 0;
volatile sig_atomic_t g_stop = 0;

void Stop(int) { g_stop = 1; }

// Watches |path| and every directory below it, without following links.
void Walk(const std::string& path, uint32_t mask) {
  if (inotify_add_watch(g_inotify, path.c_str(), mask | IN_ONLYDIR | IN_DONT_FOLLOW) < 0) return;
  ++g_watches;
  DIR* dir = opendir(path.c_str());
  if (dir == nullptr) return;
  while (const struct dirent* entry = readdir(dir)) {
    const char* name = entry->d_name;
    if (entry->d_type != DT_DIR || strcmp(name, ".") == 0 || strcmp(name, "..") == 0) continue;
    Walk(path + "/" + name, mask);
  }
  closedir(dir);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2 && argc != 3) {
    fprintf(stderr, "usage: bare_inotify_reader ROOTS [EXPECTED]\n");
    return 2;
  }
  g_inotify = inotify_init1(IN_CLOEXEC);
  FILE* roots = fopen(argv[1], "re");
  if (g_inotify < 0 || roots == nullptr) {
    perror("bare_inotify_reader");
    return 1;
  }
  char line[4096];
  while (fgets(line, sizeof(line), roots) != nullptr) {
    char* path = nullptr;
    const unsigned long mask = strtoul(line, &path, 0);
    if (*path != ' ') continue;
    ++path;
    path[strcspn(path, "\n")] = '\0';
    Walk(path, static_cast<uint32_t>(mask));
  }
  fclose(roots);
  printf("ready %lu\n", g_watches);
  fflush(stdout);
  if (argc == 2) return 0;

  // No SA_RESTART: the signal ends a blocked read.
  struct sigaction action = {};
  action.sa_handler = Stop;
  sigaction(SIGUSR1, &action, nullptr);
  const unsigned long expected = strtoul(argv[2], nullptr, 10);
  unsigned long count = 0;
  unsigned long overflows = 0;
  alignas(struct inotify_event) char buffer[64 * 1024];
  while (count < expected && !g_stop) {
    const ssize_t n = read(g_inotify, buffer, sizeof(buffer));
    if (n < 0 && errno == EINTR) continue;  // g_stop is set
    if (n <= 0) break;
    for (ssize_t i = 0; i < n;) {
      const auto* event = reinterpret_cast<const struct inotify_event*>(buffer + i);
      if (event->mask & IN_Q_OVERFLOW) {
        ++overflows;
      } else {
        ++count;
      }
      i += static_cast<ssize_t>(sizeof(struct inotify_event) + event->len);
    }
  }
  printf("done %lu %lu\n", count, overflows);
  fflush(stdout);
  while (read(0, line, sizeof(line)) > 0) {
  }
  return 0;
}
