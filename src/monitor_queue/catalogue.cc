// The read-only side of the store: the whole catalogue, one queue file, one
// queue.  Readers take no lock and cache nothing.

#include <dirent.h>
#include <sys/stat.h>

#include "monitor_queue.h"
#include "monitor_queue/log.h"
#include "monitor_queue/privileged_section.h"
#include "monitor_queue/queue_path.h"
#include "syslog_percent_m.h"
#include "platform/scoped.h"

namespace ZORV {
namespace ZORVNOTIFYD {

namespace {

bool IsRegularFile(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode);  // links are followed
}

}  // namespace

bool MonitorQueue::LoadAllByType(std::vector<MonitorQueue>& queues, _tag_monitor_queue_type_ type) {
  const std::string dir = GetConfDir(type);
  PrivilegedSection section(kSource, __LINE__);
  if (!RootCheck(kSource, __LINE__)) return false;
  platform::ScopedDir stream(opendir(dir.c_str()));
  if (stream.get() == nullptr) {
    ZORV_PERCENT_M_BEGIN
    syslog(LOG_ERR, "%s:%d cannot open dir, path=%s, reason=%m", kSource, __LINE__, dir.c_str());
    ZORV_PERCENT_M_END
    return false;
  }
  std::string path;
  while (const struct dirent* entry = readdir(stream.get())) {
    if (entry->d_name[0] == '.') continue;  // ".", ".." and hidden files
    path.assign(dir).append("/").append(entry->d_name);
    if (!IsRegularFile(path)) continue;
    if (!LoadFromFile(queues, path) && LOG_LEVEL == 7) {
      syslog(LOG_ERR, "%s:%d load monitor config fail, path=%s", kSource, __LINE__, path.c_str());
    }
  }
  return true;
}

bool MonitorQueue::LoadAll(std::vector<MonitorQueue>& queues) {
  queues.clear();
  const bool share = LoadAllByType(queues, MONITOR_QUEUE_TYPE_SHARE_DIR);
  const bool etc = LoadAllByType(queues, MONITOR_QUEUE_TYPE_ETC_DIR);
  const bool local_etc = LoadAllByType(queues, MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR);
  return share && etc && local_etc;
}

bool MonitorQueue::List(std::vector<MonitorQueue>& queues, const std::string& file,
                        _tag_monitor_queue_type_ type) {
  return LoadFromFile(queues, QueueFilePath(file, type));
}

bool MonitorQueue::Get(MonitorQueue& queue, const std::string& name, const std::string& file,
                       _tag_monitor_queue_type_ type) {
  const std::string path = QueueFilePath(file, type);
  std::vector<MonitorQueue> queues;
  if (!LoadFromFile(queues, path)) {
    syslog(LOG_ERR, "%s:%d LoadFromFile failed, path=%s", kSource, __LINE__, path.c_str());
    return false;
  }
  for (const MonitorQueue& candidate : queues) {
    if (candidate._name == name) {
      queue._name = candidate._name;
      queue._configs = candidate._configs;
      return true;
    }
  }
  syslog(LOG_ERR, "%s:%d No such monitor queue: %s", kSource, __LINE__, name.c_str());
  return false;
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
