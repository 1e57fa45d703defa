// Listing queue files.

#include "queue_files.h"

#include <dirent.h>
#include <fcntl.h>
#include <json/json.h>
#include <pwd.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <exception>
#include <memory>
#include <string>

#include "bounded_read.h"
#include "root_owned.h"
#include "text.h"
#include "unique_fd.h"

namespace zorvcommon {

bool QueueFileNames(const std::string& dir, std::vector<std::string>* names) {
  std::unique_ptr<DIR, int (*)(DIR*)> handle(opendir(dir.c_str()), closedir);
  if (!handle) return false;
  while (const struct dirent* entry = readdir(handle.get())) {
    struct stat st;
    if (entry->d_name[0] != '.' && stat((dir + "/" + entry->d_name).c_str(), &st) == 0 &&
        S_ISREG(st.st_mode)) {
      names->emplace_back(entry->d_name);
    }
  }
  std::sort(names->begin(), names->end());
  return true;
}

bool LooksLikeBackupCopy(const std::string& file) {
  for (const char* suffix : {"~", ".bak", ".orig", ".swp", ".dpkg-old", ".dpkg-new", ".dpkg-dist",
                             ".dpkg-bak", ".rpmnew", ".rpmsave", ".rpmorig"}) {
    const size_t n = strlen(suffix);
    if (file.size() > n && file.compare(file.size() - n, n, suffix) == 0) return true;
  }
  return false;
}

std::string WhyUnloadable(const std::string& path) {
  const UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  struct stat st;
  if (fd.get() < 0 || fstat(fd.get(), &st) != 0) return strerror(errno);
  if (!S_ISREG(st.st_mode)) return "not a regular file";
  std::string text;
  switch (ReadAtMost(fd.get(), kMaxQueueFileSize, &text)) {
    case BoundedRead::kWhole:
      break;
    case BoundedRead::kTooLarge:
      // The size is that of the fstat; a file that grew since then is only
      // said to be over the bound.
      return std::string("too large (") +
             (st.st_size > static_cast<off_t>(kMaxQueueFileSize)
                  ? std::to_string(st.st_size) + " bytes, "
                  : std::string()) +
             "more than the 16 MiB a queue file may hold)";
    default:
      return strerror(errno);
  }
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  builder["failIfExtra"] = true;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value root;
  std::string errors;
  bool parsed = false;
  try {
    parsed = reader->parse(text.data(), text.data() + text.size(), &root, &errors);
  } catch (const std::exception&) {
    errors = "nested too deeply";
  }
  if (!parsed) {
    errors = errors.substr(0, errors.find('\n'));
    return "not valid JSON (" + Printable(errors) + ")";
  }
  if (!root.isArray()) return "not a JSON array of queues";
  return "a queue in it has a value of the wrong type";
}

std::string UntrustedQueueFile(const std::string& dir, const std::string& file) {
  const std::string path = dir + "/" + file;
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return std::string("it cannot be checked: ") + strerror(errno);
  std::string why = NotRootsAlone(st, "it");
  if (why.empty()) why = UntrustedDirectories(dir);
  if (!why.empty()) return why;
  // A link may lead elsewhere: the directories above its target count too.
  const std::unique_ptr<char, void (*)(void*)> real(realpath(path.c_str(), nullptr), free);
  if (real == nullptr) return std::string("it cannot be checked: ") + strerror(errno);
  const std::string target(real.get());
  const std::string::size_type slash = target.rfind('/');
  return UntrustedDirectories(slash == 0 ? "/" : target.substr(0, slash));
}

}  // namespace zorvcommon
