// Registering and removing queues: a load, change and save of one queue
// file under the privileged section and the store lock, followed by a
// request to the service manager.

#include <algorithm>

#include "monitor_queue.h"
#include "monitor_queue/log.h"
#include "monitor_queue/privileged_section.h"
#include "monitor_queue/queue_path.h"
#include "platform/platform.h"

namespace ZORV {
namespace ZORVNOTIFYD {

namespace {

// The file that carries the store lock of every writer on the system.
const std::string MONITOR_QUEUE_LOCK_FILE = "/tmp/zorvnotifyd_monitor_q.lock";

constexpr char kServiceName[] = "zorvnotifyd";
constexpr int kServiceFlags = 1;

// Scoped store lock: Unlock runs on every path once Acquire was called,
// also after a failed Acquire (which may leave a descriptor open).
class StoreLock {
 public:
  StoreLock() = default;
  StoreLock(const StoreLock&) = delete;
  StoreLock& operator=(const StoreLock&) = delete;
  ~StoreLock() { Unlock(fd_); }

  bool Acquire() { return Lock(fd_, MONITOR_QUEUE_LOCK_FILE); }

 private:
  int fd_ = -1;
};

// The first queue of |queues| named exactly |name|, or end().
std::vector<MonitorQueue>::iterator FindByName(std::vector<MonitorQueue>& queues,
                                               const std::string& name) {
  return std::find_if(queues.begin(), queues.end(),
                      [&name](const MonitorQueue& queue) { return queue._name == name; });
}

}  // namespace

bool MonitorQueue::Upsert(const MonitorQueue& queue, const std::string& file,
                          _tag_monitor_queue_type_ type) {
  const std::string path = QueueFilePath(file, type);
  std::vector<MonitorQueue> queues;
  PrivilegedSection section(kSource, __LINE__);
  if (!RootCheck(kSource, __LINE__)) return false;
  StoreLock lock;
  if (!lock.Acquire()) {
    syslog(LOG_ERR, "%s:%d Lock failed", kSource, __LINE__);
    return false;
  }
  if (!LoadFromFile(queues, path)) {
    syslog(LOG_ERR, "%s:%d LoadFromFile failed, path=%s", kSource, __LINE__, path.c_str());
    return false;
  }
  const auto found = FindByName(queues, queue._name);
  if (found != queues.end()) {
    found->_name = queue._name;
    found->_configs = queue._configs;
  } else {
    queues.push_back(queue);
  }
  if (!SaveToFile(queues, path)) {
    syslog(LOG_ERR, "%s:%d SaveToFile failed, path=%s", kSource, __LINE__, path.c_str());
    return false;
  }
  if (ZORBServiceStart(kServiceName, kServiceFlags) < 0) {
    const unsigned int code = ZORBCErrGet();
    const char* error_file = ZORBCErrorGetFile();
    const int error_line = ZORBCErrorGetLine();
    syslog(LOG_ERR, "%s:%d ZORBServiceStart failed: err=[0x%04X %s:%d]", kSource, __LINE__, code,
           error_file, error_line);
  }
  return true;
}

bool MonitorQueue::Delete(const std::string& name, const std::string& file,
                          _tag_monitor_queue_type_ type) {
  const std::string path = QueueFilePath(file, type);
  std::vector<MonitorQueue> queues;
  PrivilegedSection section(kSource, __LINE__);
  if (!RootCheck(kSource, __LINE__)) return false;
  StoreLock lock;
  if (!lock.Acquire()) {
    syslog(LOG_ERR, "%s:%d Lock failed", kSource, __LINE__);
    return false;
  }
  if (!LoadFromFile(queues, path)) {
    syslog(LOG_ERR, "%s:%d LoadFromFile failed, path=%s", kSource, __LINE__, path.c_str());
    return false;
  }
  const auto found = FindByName(queues, name);
  if (found == queues.end()) return true;  // nothing to remove: no write, no service request
  queues.erase(found);
  if (!SaveToFile(queues, path)) {
    syslog(LOG_ERR, "%s:%d SaveToFile failed, path=%s", kSource, __LINE__, path.c_str());
    return false;
  }
  // The service goes only when the whole catalogue, counted under the lock,
  // holds no queue; a failed count leaves it running.
  if (LoadAll(queues) && queues.empty() && ZORBServiceStop(kServiceName, kServiceFlags) < 0) {
    const unsigned int code = ZORBCErrGet();
    const char* error_file = ZORBCErrorGetFile();
    const int error_line = ZORBCErrorGetLine();
    syslog(LOG_ERR, "%s:%d ZORBServiceStop failed: err=[0x%04X %s:%d]", kSource, __LINE__, code,
           error_file, error_line);
  }
  return true;
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
