// Loading the catalogue type by type, file by file in name order.

#include "catalogue_view.h"

#include <cerrno>
#include <cstring>
#include <iostream>

#include "queue_files.h"
#include "text.h"

namespace zorvnotifyctl {

using ZORV::ZORVNOTIFYD::MonitorQueue;

std::string RefusedQueueFile(const std::string& path, const std::string& why) {
  return "queue file " + zorvcommon::Printable(path) + " is refused: " + why +
         "; none of its queues is loaded (root alone must be able to change it and its "
         "directories)";
}

bool LoadCatalogue(std::vector<TypedQueue>* queues, bool* complete) {
  queues->clear();
  *complete = true;
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
      const std::string untrusted = zorvcommon::UntrustedQueueFile(dir, file);
      if (!untrusted.empty()) {
        std::cerr << "zorvnotifyctl: " << RefusedQueueFile(dir + "/" + file, untrusted) << '\n';
        *complete = false;
        continue;
      }
      std::vector<MonitorQueue> loaded;
      if (!MonitorQueue::List(loaded, file, type)) {  // a failing file keeps what it appended
        std::cerr << "zorvnotifyctl: queue file " << label << " could not be read completely: "
                  << zorvcommon::WhyUnloadable(dir + "/" + file) << "; "
                  << (loaded.empty()
                          ? std::string("none of its queues is shown")
                          : "only its first " + std::to_string(loaded.size()) + " queues are shown")
                  << '\n';
        *complete = false;
      }
      for (const MonitorQueue& queue : loaded) queues->push_back(TypedQueue{type, queue});
    }
  }
  return true;
}

}  // namespace zorvnotifyctl
