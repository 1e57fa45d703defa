// Checking configuration paths against what the watcher can report.

#include "watch_path.h"

#include <string>
#include <string_view>
#include <vector>

namespace zorvcommon {
namespace {

// |path| with empty and "." components dropped and ".." taken lexically, as
// an absolute path; "/" when nothing is left.
std::string Normalised(const std::string& path) {
  std::vector<std::string> parts;
  size_t start = 0;
  while (start <= path.size()) {
    size_t end = path.find('/', start);
    if (end == std::string::npos) end = path.size();
    const std::string part = path.substr(start, end - start);
    if (part == "..") {
      if (!parts.empty()) parts.pop_back();
    } else if (!part.empty() && part != ".") {
      parts.push_back(part);
    }
    start = end + 1;
  }
  std::string result;
  for (const std::string& part : parts) result += "/" + part;
  return result.empty() ? "/" : result;
}

// True when |path| is absolute and already normal: a "/" and then
// components that are neither empty, "." nor "..", with no "/" at the end
// (so not "/" itself).  The common case, told without building the
// normalised form.
bool IsNormal(std::string_view path) {
  if (path.size() < 2 || path[0] != '/' || path.back() == '/') return false;
  for (size_t start = 1;;) {
    size_t end = path.find('/', start);
    if (end == std::string_view::npos) end = path.size();
    const std::string_view part = path.substr(start, end - start);
    if (part.empty() || part == "." || part == "..") return false;
    if (end == path.size()) return true;
    start = end + 1;
  }
}

}  // namespace

std::string WatchPathProblem(const std::string& path) {
  if (path.empty()) {
    return "it is empty, which would match every absolute path; name the directory tree to watch, "
           "such as \"/srv/share\"";
  }
  if (path.find('\0') != std::string::npos) return "it holds a NUL byte, which no path can hold";
  if (path[0] != '/') {
    return "it is relative, and events carry absolute paths; write it as an absolute path "
           "such as \"/" +
           path + "\"";
  }
  if (IsNormal(path)) return "";
  const std::string normal = Normalised(path);
  if (normal == "/") {
    return "it is the root directory, which is never watched as a whole; name the directory "
           "trees to watch, such as \"/srv/share\"";
  }
  if (normal == path) return "";
  const char* why = path.back() == '/'                     ? "it ends in \"/\""
                    : path.find("//") != std::string::npos ? "it holds \"//\""
                                                           : "it holds a \".\" or \"..\" component";
  return std::string(why) + ", which no reported path can match; write it as \"" + normal + "\"";
}

}  // namespace zorvcommon
