// Opening the journal directory and keeping its id.

#include "journal_dir.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <syslog.h>
#include <time.h>
#include <unistd.h>

#include <cstdio>

namespace zorvnotifyd {
namespace {

constexpr size_t kIdSize = 32;

// Reads at most |max| bytes of the regular file |name| in |dir| (O_NOFOLLOW,
// never blocking); false when it is not one, or unreadable.
bool ReadSmall(int dir, const char* name, size_t max, std::string* text) {
  UniqueFd fd(openat(dir, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  struct stat st;
  if (fd.get() < 0 || fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode) || st.st_uid != 0) {
    return false;
  }
  text->resize(max);
  const ssize_t n = read(fd.get(), &(*text)[0], max);
  if (n < 0) return false;
  text->resize(size_t(n));
  return true;
}

bool IsId(const std::string& text) {
  if (text.size() != kIdSize + 1 || text.back() != '\n') return false;
  for (size_t i = 0; i < kIdSize; ++i) {
    if (!((text[i] >= '0' && text[i] <= '9') || (text[i] >= 'a' && text[i] <= 'f'))) return false;
  }
  return true;
}

}  // namespace

std::string RandomId() {
  unsigned char bytes[16] = {};
  if (getrandom(bytes, sizeof(bytes), 0) != ssize_t(sizeof(bytes))) {
    struct timespec now;
    clock_gettime(CLOCK_REALTIME, &now);
    const uint64_t seed = uint64_t(now.tv_sec) * 1000000000ull + uint64_t(now.tv_nsec);
    const uint64_t pid = uint64_t(getpid());
    memcpy(bytes, &seed, sizeof(seed));
    memcpy(bytes + 8, &pid, sizeof(pid));
  }
  std::string id;
  char digits[3];
  for (unsigned char byte : bytes) {
    snprintf(digits, sizeof(digits), "%02x", byte);
    id += digits;
  }
  return id;
}

bool JournalDir::Open(const StateDir& state) {
  std::string reason;
  fd_ = state.OpenSubdirectory("journal", &reason);
  if (fd_.get() < 0) {
    id_ = RandomId();
    syslog(LOG_ERR,
           "cannot keep journals: the journal directory %s; records are kept in memory only, "
           "and the journal id changes at each start",
           reason.c_str());
    return false;
  }
  std::string text;
  if (ReadSmall(fd_.get(), "id", kIdSize + 2, &text) && IsId(text)) {
    id_ = text.substr(0, kIdSize);
    return true;
  }
  // No usable id: what the directory holds is of no known journal.
  id_ = RandomId();
  syslog(LOG_NOTICE, "starting a new journal %s in %s/journal", id_.c_str(), state.path().c_str());
  Empty();
  WriteId();
  return true;
}

const std::string& JournalDir::Renew() {
  id_ = RandomId();
  syslog(LOG_NOTICE, "starting a new journal %s: a queue's numbering was lost", id_.c_str());
  if (fd_.get() >= 0) WriteId();
  return id_;
}

void JournalDir::Empty() {
  const int copy = openat(fd_.get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  DIR* dir = copy >= 0 ? fdopendir(copy) : nullptr;
  if (dir == nullptr) {
    if (copy >= 0) close(copy);
    return;
  }
  while (const struct dirent* entry = readdir(dir)) {
    if (strcmp(entry->d_name, ".") == 0 || strcmp(entry->d_name, "..") == 0) continue;
    unlinkat(fd_.get(), entry->d_name, 0);
  }
  closedir(dir);
}

bool JournalDir::WriteId() {
  const std::string text = id_ + "\n";
  unlinkat(fd_.get(), "id.new", 0);
  UniqueFd fd(
      openat(fd_.get(), "id.new", O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (fd.get() < 0 || write(fd.get(), text.data(), text.size()) != ssize_t(text.size()) ||
      fdatasync(fd.get()) != 0 || renameat(fd_.get(), "id.new", fd_.get(), "id") != 0 ||
      fsync(fd_.get()) != 0) {
    syslog(LOG_ERR, "cannot write the journal id: %s; it changes at the next start",
           strerror(errno));
    return false;
  }
  return true;
}

}  // namespace zorvnotifyd
