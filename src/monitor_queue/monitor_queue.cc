// The monitor queue record and its JSON form, and the library's one global.

#include "monitor_queue.h"

#include <utility>

namespace ZORV {
namespace ZORVNOTIFYD {

int LOG_LEVEL = 3;

MonitorQueue::MonitorQueue(const Json::Value& value) {
  if (!value.isObject()) return;
  _name = value["queue"].asString();  // in place; null when missing: ""
  // Read in place: a copy of the array would duplicate every configuration.
  const Json::Value& configs = value["config"];  // null when missing
  if (!configs.isArray()) return;
  _configs.reserve(configs.size());
  for (Json::Value::ArrayIndex i = 0; i < configs.size(); ++i) {
    _configs.emplace_back(configs[i]);
  }
}

MonitorQueue::MonitorQueue(const MonitorQueue& other)
    : _name(other._name), _configs(other._configs) {}

MonitorQueue& MonitorQueue::operator=(const MonitorQueue& other) {
  _name = other._name;
  _configs = other._configs;
  return *this;
}

MonitorQueue::~MonitorQueue() = default;

Json::Value MonitorQueue::ToJson() const {
  Json::Value object(Json::objectValue);
  object["queue"] = _name;
  Json::Value configs(Json::arrayValue);
  for (const MonitorQueueConfig& config : _configs) configs.append(config.ToJson());
  object["config"] = std::move(configs);
  return object;
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
