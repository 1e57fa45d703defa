// A program that links an installed libzorvnotifyd: builds a queue from
// JSON, copies it, asks matching questions of it and of an index over it,
// and writes it back.  The build checks run it against the staged install;
// it needs no privileges.  It spells its includes both ways the installed
// headers are found: <monitor_queue.h> and <zorvnotifyd/monitor_queue.h>.

#include <iostream>
#include <sstream>
#include <vector>

#include <monitor_queue.h>
#include <thread.h>
#include <zorvnotifyd/monitor_queue_index.h>
#include <zorvnotifyd/zorvnotifyd_export.h>

using ZORV::ZORVNOTIFYD::MonitorQueue;

int main() {
  Json::Value json;
  std::istringstream(R"({"queue": "backup",
      "config": [{"path": "/vol/share", "mask": 258, "ignore": ["\\.tmp$"]}]})") >>
      json;
  const MonitorQueue queue(json);
  MonitorQueue copy = queue;
  const bool wanted = copy.IsMonitoring("/vol/share/report.txt", 2);
  const bool ignored = !copy.IsMonitoring("/vol/share/report.tmp", 2);
  const ZORV::ZORVNOTIFYD::MonitorQueueIndex index({queue});
  std::vector<size_t> wanting;
  index.Match("/vol/share/report.txt", 2, wanting);
  Json::StreamWriterBuilder writer;
  writer["indentation"] = "";
  std::cout << Json::writeString(writer, copy.ToJson()) << "\n";
  if (!wanted || !ignored || copy.ToJson() != queue.ToJson() || wanting != std::vector<size_t>{0}) {
    std::cerr << "consumer: unexpected answer from the library\n";
    return 1;
  }
  std::cout << "consumer: ok\n";
  return 0;
}
