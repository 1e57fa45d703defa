// Loading the catalogue type by type, file by file in name order.

#include "catalogue_view.h"

#include <cerrno>
#include <cstring>
#include <iostream>

#include "queue_files.h"
#include "text.h"

namespace zorvnotifyctl {

using ZORV::ZORVNOTIFYD::MonitorQueue;

bool LoadCatalogue(std::vector<TypedQueue>* queues) {
  queues->clear();
  for (QueueType type : kAllQueueTypes) {
    // The library creates the directory when it is missing and it can.
    const std::string dir = MonitorQueue::GetConfDir(type);
    std::vector<std::string> files;
    if (!zorvcommon::QueueFileNames(dir, &files)) {
      const int error = errno;
      if (error == ENOENT) {
        std::cerr << "zorvnotifyctl: warning: the configuration directory " << dir
                  << " is missing and could not be created; the " << QueueTypeName(type)
                  << " type counts as empty\n";
        continue;
      }
      std::cerr << "zorvnotifyctl: cannot read the configuration directory " << dir << ": "
                << strerror(error) << '\n';
      queues->clear();
      return false;
    }
    for (const std::string& file : files) {
      const std::string label =
          zorvcommon::Printable(std::string(QueueTypeName(type)) + "/" + file);
      if (zorvcommon::LooksLikeBackupCopy(file)) {
        std::cerr << "zorvnotifyctl: warning: queue file " << label
                  << " looks like a backup copy, and is loaded like any queue file: remove it or "
                     "move it out of the directory\n";
      }
      std::vector<MonitorQueue> loaded;
      MonitorQueue::List(loaded, file, type);  // a failing file keeps what it appended
      for (const MonitorQueue& queue : loaded) queues->push_back(TypedQueue{type, queue});
    }
  }
  return true;
}

}  // namespace zorvnotifyctl
