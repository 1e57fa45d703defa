// Reading and writing whole JSON files.
//
// A write never exposes a partial file: the text goes to a temporary file in
// the target's directory, which is synced and renamed over the target, and
// the directory is synced so that the rename survives a crash.  The
// temporary file is named ".<name>.tmp.XXXXXX": the leading "." keeps the
// catalogue scan away from it.  Its writer holds an flock on it while it
// lives, so a later writer can tell a file abandoned by a killed process
// (no lock) from one still being written (locked) and remove only the first.

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <exception>
#include <memory>
#include <string>

#include "platform/platform.h"
#include "platform/scoped.h"

namespace ZORV {
namespace ZORVNOTIFYD {
namespace platform {

namespace {

// Splits |path| into its directory ("." when there is none) and last name.
void SplitPath(const std::string& path, std::string& dir, std::string& name) {
  const std::string::size_type slash = path.rfind('/');
  if (slash == std::string::npos) {
    dir = ".";
    name = path;
  } else {
    dir = slash == 0 ? "/" : path.substr(0, slash);
    name = path.substr(slash + 1);
  }
}

bool WriteAll(int fd, const std::string& text) {
  const char* data = text.data();
  size_t left = text.size();
  while (left > 0) {
    const ssize_t n = write(fd, data, left);
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    data += n;
    left -= static_cast<size_t>(n);
  }
  return true;
}

// Reads |fd| to its end, or until |text| holds |limit| bytes.
bool ReadAll(int fd, std::string& text, size_t limit) {
  char buffer[8192];
  while (text.size() < limit) {
    const ssize_t n = read(fd, buffer, std::min(sizeof buffer, limit - text.size()));
    if (n == 0) return true;
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    text.append(buffer, static_cast<size_t>(n));
  }
  return true;
}

bool SyncDirectory(const std::string& dir) {
  ScopedFd fd(open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return fd.valid() && fsync(fd.get()) == 0;
}

// Removes the temporary files of |dir| that begin with |prefix| and whose
// writer is gone (nobody holds their flock).
void RemoveAbandoned(const std::string& dir, const std::string& prefix) {
  ScopedDir stream(opendir(dir.c_str()));
  if (stream.get() == nullptr) return;
  while (const struct dirent* entry = readdir(stream.get())) {
    if (strncmp(entry->d_name, prefix.c_str(), prefix.size()) != 0) continue;
    const std::string path = dir + "/" + entry->d_name;
    ScopedFd fd(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    if (!fd.valid() || flock(fd.get(), LOCK_EX | LOCK_NB) != 0) continue;
    struct stat held;
    struct stat named;
    // Unlink only the very file we hold, not one renamed into its place.
    if (fstat(fd.get(), &held) == 0 && lstat(path.c_str(), &named) == 0 &&
        held.st_dev == named.st_dev && held.st_ino == named.st_ino) {
      unlink(path.c_str());
    }
  }
}

}  // namespace

bool ReadRegularFile(const std::string& path, std::string& text) {
  // Non-blocking, so that opening a fifo never waits for a writer; the type
  // and size are those of the file opened, not of whatever the path names
  // by then.  Only a regular file is read, and never past one byte over the
  // limit: a file that grows after the check is refused all the same.
  ScopedFd fd(open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
  struct stat st;
  if (!fd.valid() || fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode) ||
      st.st_size > static_cast<off_t>(kMaxJsonFileSize)) {
    return false;
  }
  std::string read;
  read.reserve(static_cast<size_t>(st.st_size));
  if (!ReadAll(fd.get(), read, kMaxJsonFileSize + 1) || read.size() > kMaxJsonFileSize) {
    return false;
  }
  text.swap(read);
  return true;
}

bool JsonFromText(Json::Value& value, const std::string& text) {
  Json::CharReaderBuilder builder;
  builder["collectComments"] = false;
  builder["failIfExtra"] = true;
  builder["allowSingleQuotes"] = false;
  builder["allowSpecialFloats"] = false;
  builder["allowDroppedNullPlaceholders"] = false;
  builder["allowNumericKeys"] = false;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value parsed;
  try {
    if (!reader->parse(text.data(), text.data() + text.size(), &parsed, nullptr)) return false;
  } catch (const std::exception&) {
    return false;  // nesting beyond the reader's stack limit
  }
  value.swap(parsed);
  return true;
}

bool JsonFromFile(Json::Value& value, const std::string& path) {
  std::string text;
  return ReadRegularFile(path, text) && JsonFromText(value, text);
}

bool JsonToFile(const Json::Value& value, const std::string& path, ScopedFd& written) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "  ";
  // Strings go out byte for byte (only quotes, backslashes and control
  // bytes are escaped).  By default the writer decodes them as UTF-8 and
  // writes \u escapes, which replaces any byte that is not valid UTF-8 and
  // can swallow the bytes after it ("caf\xe9/x" came back as "caf\u9bf8"),
  // so paths and names that are not UTF-8 would not survive a save.
  builder["emitUTF8"] = true;
  std::string text = Json::writeString(builder, value);
  text.push_back('\n');
  // A file JsonFromFile would refuse is never written: saving it would make
  // every other queue of the file unreadable until it is replaced.
  if (text.size() > kMaxJsonFileSize) return false;

  std::string dir;
  std::string name;
  SplitPath(path, dir, name);
  if (name.empty()) return false;
  const std::string prefix = "." + name + ".tmp.";
  std::string temp = dir + "/" + prefix + "XXXXXX";

  ScopedFd fd(mkostemp(&temp[0], O_CLOEXEC));  // created with mode 0600
  if (!fd.valid()) return false;
  bool ok = flock(fd.get(), LOCK_EX) == 0 && WriteAll(fd.get(), text) && fsync(fd.get()) == 0 &&
            rename(temp.c_str(), path.c_str()) == 0;
  if (!ok) {
    unlink(temp.c_str());
    return false;
  }
  ok = SyncDirectory(dir);
  RemoveAbandoned(dir, prefix);
  if (ok) written.Reset(fd.Release());
  return ok;
}

}  // namespace platform
}  // namespace ZORVNOTIFYD
}  // namespace ZORV
