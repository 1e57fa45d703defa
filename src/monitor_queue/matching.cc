// Path matching: which configurations want an event on a path, which lie at
// or below a directory, and which event kinds are wanted there.
//
// Every comparison is on bytes, in place, with no normalisation of either
// side; "/" (0x2F) is the only byte with a meaning.  IsMonitoring and
// IsDirMonitoring build no temporary strings, so once a configuration is
// prepared they allocate nothing from the C++ heap.

#include "monitor_queue.h"

#include <cstdint>
#include <cstring>

#include "monitor_queue/literal_pattern.h"

namespace ZORV {
namespace ZORVNOTIFYD {

namespace {

// True when |text| is at least as long as |prefix| and its first
// prefix.size() bytes equal |prefix|.
bool BeginsWith(const std::string& text, const std::string& prefix) {
  return text.size() >= prefix.size() &&
         std::memcmp(text.data(), prefix.data(), prefix.size()) == 0;
}

// True when |path| is |dir| itself or lies below it: |path| begins with
// |dir| and, when longer, the byte after that prefix is "/".  This is the
// path test of IsMonitoring and the directory test of GetUnionMask.
bool IsAtOrBelow(const std::string& path, const std::string& dir) {
  return BeginsWith(path, dir) && (path.size() == dir.size() || path[dir.size()] == '/');
}

// True when an ignore pattern of the prepared |config| matches |path|.
// Kept out of line, so that the mask and path tests before it stay small.
__attribute__((noinline)) bool Ignored(const MonitorQueue::MonitorQueueConfig& config,
                                       const std::string& path) {
  // When every pattern compiled, _regexes[i] is _ignore[i] compiled, and a
  // pattern of a literal shape is answered from its text, as regexec would;
  // otherwise the correspondence is unknown and regexec answers them all.
  const bool by_text = config._regexes.size() == config._ignore.size();
  // The bytes regexec reads (up to a NUL byte), measured on the first
  // literal pattern; kByRegexec when the locale leaves literals to regexec.
  constexpr size_t kUnmeasured = SIZE_MAX, kByRegexec = SIZE_MAX - 1;
  size_t length = kUnmeasured;
  for (size_t i = 0; i < config._regexes.size(); ++i) {
    LiteralPattern literal;
    if (by_text && length != kByRegexec && literal.Parse(config._ignore[i].c_str())) {
      if (length == kUnmeasured) {
        length = LiteralAnswersHere() ? std::strlen(path.c_str()) : kByRegexec;
      }
      if (length != kByRegexec) {
        if (literal.Matches(path.c_str(), length)) return true;
        continue;
      }
    }
    // Any result other than 0 (a match) counts as no match, so a regexec
    // failure leaves the path monitored.
    if (regexec(&config._regexes[i], path.c_str(), 0, nullptr, 0) == 0) return true;
  }
  return false;
}

// The body of MonitorQueueConfig::IsMonitoring.  The queue form calls it
// directly: the member functions are exported and therefore interposable,
// so a call through them would not be inlined.
inline bool ConfigWants(MonitorQueue::MonitorQueueConfig& config, const std::string& path,
                        unsigned int mask) {
  // Cheapest test first: the mask, then the path, and only then the
  // patterns, which are compiled here on the first call that reaches them.
  if ((mask & config._mask) == 0) return false;
  if (!IsAtOrBelow(path, config._path)) return false;
  if (!config._prepared) config.PrepareRegex();
  return config._regexes.empty() || !Ignored(config, path);
}

// The body of MonitorQueueConfig::IsDirMonitoring, shared with the queue
// and list forms for the same reason.
inline bool ConfigIsAtOrBelow(const MonitorQueue::MonitorQueueConfig& config,
                              const std::string& dir) {
  if (!BeginsWith(config._path, dir)) return false;
  // A directory given with a trailing "/" already carries its boundary.
  if (!dir.empty() && dir.back() == '/') return true;
  return config._path.size() == dir.size() || config._path[dir.size()] == '/';
}

// True when some configuration of |queue| lies at or below |dir|.
inline bool QueueIsAtOrBelow(const MonitorQueue& queue, const std::string& dir) {
  for (const MonitorQueue::MonitorQueueConfig& config : queue._configs) {
    if (ConfigIsAtOrBelow(config, dir)) return true;
  }
  return false;
}

}  // namespace

bool MonitorQueue::MonitorQueueConfig::IsMonitoring(const std::string& path,
                                                    const unsigned int& mask) {
  return ConfigWants(*this, path, mask);
}

bool MonitorQueue::MonitorQueueConfig::IsDirMonitoring(const std::string& dir) const {
  return ConfigIsAtOrBelow(*this, dir);
}

bool MonitorQueue::IsMonitoring(const std::string& path, const unsigned int& mask) {
  // Each configuration's patterns apply to that configuration only; the
  // first one that wants the event decides, and the rest stay untouched.
  for (MonitorQueueConfig& config : _configs) {
    if (ConfigWants(config, path, mask)) return true;
  }
  return false;
}

bool MonitorQueue::IsDirMonitoring(const std::string& dir) const {
  return QueueIsAtOrBelow(*this, dir);
}

bool MonitorQueue::IsDirMonitoring(const std::vector<MonitorQueue>& queues,
                                   const std::string& dir) {
  for (const MonitorQueue& queue : queues) {
    if (QueueIsAtOrBelow(queue, dir)) return true;
  }
  return false;
}

unsigned int MonitorQueue::GetUnionMask(const std::string& dir) const {
  // A configuration counts when its path followed by "/" begins with |dir|
  // followed by "/".  That holds exactly when the path begins with |dir| and
  // is either |dir| itself or continues with "/", which is tested in place
  // rather than on the two concatenated strings.  Unlike IsDirMonitoring, a
  // |dir| that ends in "/" gets no shortcut: "/a/" selects only "/a/" and
  // paths that begin with "/a//".
  unsigned int mask = 0;
  for (const MonitorQueueConfig& config : _configs) {
    if (IsAtOrBelow(config._path, dir)) mask |= config._mask;
  }
  return mask;
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
