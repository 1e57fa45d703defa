// The share set: the top-level shared folders (the first two components of
// an absolute path) that the watch configurations of some queues reach into.

#include "monitor_queue.h"

#include <cstddef>

namespace ZORV {
namespace ZORVNOTIFYD {

void MonitorQueue::CollectShareSet(std::set<std::string>& shares) const {
  for (const MonitorQueueConfig& config : _configs) {
    const std::string& path = config._path;
    if (path.empty() || path[0] != '/') continue;  // relative or empty
    // The "/" that ends the first component; none for "/" or "/vol".
    const std::size_t first = path.find('/', 1);
    if (first == std::string::npos) continue;
    // The "/" that ends the second component.  Without one the whole path is
    // the prefix, which keeps the trailing "/" of a path such as "/vol/".
    // Repeated "/" are not collapsed: "/a//b" yields "/a/" and "//x" yields
    // "//x".
    const std::size_t second = path.find('/', first + 1);
    shares.insert(path.substr(0, second));
  }
}

std::set<std::string> MonitorQueue::GetShareSet(const std::vector<MonitorQueue>& queues) {
  std::set<std::string> shares;
  for (const MonitorQueue& queue : queues) queue.CollectShareSet(shares);
  return shares;
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
