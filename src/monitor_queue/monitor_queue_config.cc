// The watch configuration record: JSON form, copy and move, and ownership of
// the compiled-pattern cache.

#include "monitor_queue.h"

#include <utility>

namespace ZORV {
namespace ZORVNOTIFYD {

namespace {

// Releases every compiled pattern of |regexes| exactly once and empties it.
void ReleaseRegexes(std::vector<regex_t>& regexes) {
  for (regex_t& regex : regexes) regfree(&regex);
  regexes.clear();
}

}  // namespace

MonitorQueue::MonitorQueueConfig::MonitorQueueConfig(const Json::Value& value)
    : _mask(0), _prepared(false) {
  if (!value.isObject()) return;
  // Members read in place (null when missing: "" and 0), not copied out.
  const Json::Value& ignore = value["ignore"];
  _path = value["path"].asString();
  _mask = value["mask"].asUInt();
  if (ignore.isArray()) {
    _ignore.reserve(ignore.size());
    for (Json::Value::ArrayIndex i = 0; i < ignore.size(); ++i) {
      _ignore.push_back(ignore[i].asString());
    }
  }
}

MonitorQueue::MonitorQueueConfig::MonitorQueueConfig(const MonitorQueueConfig& other)
    : _path(other._path), _mask(other._mask), _ignore(other._ignore), _prepared(false) {}

MonitorQueue::MonitorQueueConfig::MonitorQueueConfig(MonitorQueueConfig&& other) noexcept
    : _path(std::move(other._path)),
      _mask(other._mask),
      _ignore(std::move(other._ignore)),
      _regexes(std::move(other._regexes)),
      _prepared(other._prepared) {
  other._path.clear();
  other._ignore.clear();
  other._regexes.clear();
  other._prepared = false;
}

MonitorQueue::MonitorQueueConfig& MonitorQueue::MonitorQueueConfig::operator=(
    const MonitorQueueConfig& other) {
  ReleaseRegexes(_regexes);
  _prepared = false;
  if (this != &other) {
    _path = other._path;
    _mask = other._mask;
    _ignore = other._ignore;
  }
  return *this;
}

MonitorQueue::MonitorQueueConfig& MonitorQueue::MonitorQueueConfig::operator=(
    MonitorQueueConfig&& other) noexcept {
  ReleaseRegexes(_regexes);
  if (this == &other) {
    _prepared = false;
    return *this;
  }
  _path = std::move(other._path);
  _mask = other._mask;
  _ignore = std::move(other._ignore);
  _regexes = std::move(other._regexes);
  _prepared = other._prepared;
  other._path.clear();
  other._ignore.clear();
  other._regexes.clear();
  other._prepared = false;
  return *this;
}

MonitorQueue::MonitorQueueConfig::~MonitorQueueConfig() { ReleaseRegexes(_regexes); }

Json::Value MonitorQueue::MonitorQueueConfig::ToJson() const {
  Json::Value object(Json::objectValue);
  object["path"] = _path;
  object["mask"] = _mask;
  Json::Value ignore(Json::arrayValue);
  for (const std::string& pattern : _ignore) ignore.append(pattern);
  object["ignore"] = std::move(ignore);
  return object;
}

void MonitorQueue::MonitorQueueConfig::PrepareRegex() {
  for (const std::string& pattern : _ignore) {
    regex_t regex;
    if (regcomp(&regex, pattern.c_str(), REG_EXTENDED) != 0) continue;
    try {
      _regexes.push_back(regex);
    } catch (...) {
      regfree(&regex);
      throw;
    }
  }
  _prepared = true;
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
