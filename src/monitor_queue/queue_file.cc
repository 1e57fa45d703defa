// Queue files: one JSON array of queue objects per file.

#include <errno.h>
#include <sys/stat.h>
#include <unistd.h>

#include <exception>
#include <string>

#include "monitor_queue.h"
#include "monitor_queue/log.h"
#include "monitor_queue/privileged_section.h"
#include "monitor_queue/queue_file_parser.h"
#include "platform/platform.h"
#include "platform/scoped.h"
#include "syslog_percent_m.h"

namespace ZORV {
namespace ZORVNOTIFYD {

namespace {

constexpr mode_t kQueueFileMode = 0600;

}  // namespace

bool MonitorQueue::SaveToFile(const std::vector<MonitorQueue>& queues, const std::string& path) {
  Json::Value root(Json::arrayValue);
  PrivilegedSection section(kSource, __LINE__);
  if (!RootCheck(kSource, __LINE__)) return false;
  for (const MonitorQueue& queue : queues) root.append(queue.ToJson());
  platform::ScopedFd written;
  if (!platform::JsonToFile(root, path, written)) {
    syslog(LOG_ERR, "%s:%d Failed to save json", kSource, __LINE__);
    return false;
  }
  // The mode is set on the file just written, through its descriptor: a
  // link put at |path| since the write is never followed.
  if (fchmod(written.get(), kQueueFileMode) < 0) {
    ZORV_PERCENT_M_BEGIN
    syslog(LOG_ERR, "%s:%d chmod failed, path=%s, reason=%m", kSource, __LINE__, path.c_str());
    ZORV_PERCENT_M_END
    unlink(path.c_str());
    return false;
  }
  return true;
}

bool MonitorQueue::LoadFromFile(std::vector<MonitorQueue>& queues, const std::string& path) {
  Json::Value root(Json::arrayValue);
  PrivilegedSection section(kSource, __LINE__);
  if (!RootCheck(kSource, __LINE__)) return false;
  if (ZORBCFileExist(path.c_str()) == 1) {
    std::string text;
    if (!platform::ReadRegularFile(path, text)) return false;
    // Files in the form the library writes are read straight into records;
    // the JSON reader decides every other text, the same bytes.
    if (ParseQueueFileSubset(text.data(), text.size(), queues)) return true;
    if (!platform::JsonFromText(root, text)) return false;
  }
  if (!root.isArray()) return false;
  try {
    // Made in place, in room reserved: a MonitorQueue is copied, not moved.
    queues.reserve(queues.size() + root.size());
    for (Json::Value::ArrayIndex i = 0; i < root.size(); ++i) queues.emplace_back(root[i]);
  } catch (const std::exception&) {
    return false;  // the queues of the elements before the faulty one stay
  }
  return true;
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
