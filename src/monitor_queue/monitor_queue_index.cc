// The catalogue-wide index: configurations grouped by path, found by a hash
// of each prefix of the asked path, and ignore patterns compiled once per
// distinct text.

#include "monitor_queue_index.h"

#include <regex.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <unordered_map>

namespace ZORV {
namespace ZORVNOTIFYD {

namespace {

// FNV-1a, 64 bits: the hash of every prefix of a path comes from one pass.
constexpr uint64_t kHashStart = 14695981039346656037ull;
constexpr uint64_t kHashStep = 1099511628211ull;

inline uint64_t HashByte(uint64_t hash, char byte) {
  return (hash ^ static_cast<unsigned char>(byte)) * kHashStep;
}

uint64_t Hash(const std::string& text) {
  uint64_t hash = kHashStart;
  for (char byte : text) hash = HashByte(hash, byte);
  return hash;
}

// One compiled pattern, freed exactly once.
class Pattern {
 public:
  // Compiles |text| as PrepareRegex does; ok() tells whether it compiled.
  explicit Pattern(const std::string& text)
      : ok_(regcomp(&regex_, text.c_str(), REG_EXTENDED) == 0) {}
  ~Pattern() {
    if (ok_) regfree(&regex_);
  }
  Pattern(const Pattern&) = delete;
  Pattern& operator=(const Pattern&) = delete;
  bool ok() const { return ok_; }
  // True when the pattern matches |path| (regexec result 0).
  bool Matches(const char* path) const { return regexec(&regex_, path, 0, nullptr, 0) == 0; }

 private:
  regex_t regex_;
  bool ok_;
};

// Per-thread scratch of Match: which patterns ran and which queues matched
// during the current call, stamped with the call's number so that nothing
// needs clearing between calls.
struct Scratch {
  std::vector<uint32_t> pattern_stamp;
  std::vector<uint8_t> pattern_matched;
  std::vector<uint32_t> queue_stamp;
  uint32_t call = 0;

  // Starts a call over |patterns| patterns and |queues| queues.
  void Begin(size_t patterns, size_t queues) {
    if (++call == 0) {  // wrapped: old stamps could look current
      std::fill(pattern_stamp.begin(), pattern_stamp.end(), 0);
      std::fill(queue_stamp.begin(), queue_stamp.end(), 0);
      call = 1;
    }
    if (pattern_stamp.size() < patterns) {
      pattern_stamp.resize(patterns, 0);
      pattern_matched.resize(patterns, 0);
    }
    if (queue_stamp.size() < queues) queue_stamp.resize(queues, 0);
  }
};

thread_local Scratch g_match_scratch;

}  // namespace

// One configuration: its queue, mask and compiled patterns.
struct IndexEntry {
  uint32_t queue;
  unsigned int mask;
  uint32_t first_pattern;  // into MonitorQueueIndexData::pattern_ids
  uint32_t pattern_count;
};

// All configurations with one path.
struct IndexNode {
  std::string path;
  uint64_t hash;
  unsigned int mask;  // the OR of the entries' masks
  uint32_t first_entry;
  uint32_t entry_count;
};

struct MonitorQueueIndexData {
  size_t queues = 0;
  std::vector<IndexNode> nodes;  // sorted by path
  std::vector<IndexEntry> entries;
  std::vector<uint32_t> pattern_ids;
  std::vector<std::unique_ptr<Pattern>> patterns;
  std::vector<uint32_t> slots;  // open addressing: node index + 1, 0 when free

  // The node whose path is the first |length| bytes of |path|, whose hash is
  // |hash|; null when there is none.
  const IndexNode* Find(uint64_t hash, const std::string& path, size_t length) const {
    if (slots.empty()) return nullptr;
    const size_t mask = slots.size() - 1;
    for (size_t slot = hash & mask; slots[slot] != 0; slot = (slot + 1) & mask) {
      const IndexNode& node = nodes[slots[slot] - 1];
      if (node.hash == hash && node.path.size() == length &&
          std::memcmp(node.path.data(), path.data(), length) == 0) {
        return &node;
      }
    }
    return nullptr;
  }

  // Calls |visit| with each node whose path is |path| or an ancestor of it
  // by the boundary rule: the prefixes that end before a "/" or at the end.
  template <typename Visit>
  void ForEachAncestor(const std::string& path, Visit visit) const {
    uint64_t hash = kHashStart;
    for (size_t length = 0;; ++length) {
      if (length == path.size() || path[length] == '/') {
        if (const IndexNode* node = Find(hash, path, length)) visit(*node);
      }
      if (length == path.size()) return;
      hash = HashByte(hash, path[length]);
    }
  }
};

MonitorQueueIndex::MonitorQueueIndex(const std::vector<MonitorQueue>& queues) {
  auto data = std::make_shared<MonitorQueueIndexData>();
  data->queues = queues.size();
  // Patterns by the text regcomp sees (up to a NUL byte), compiled once.
  std::unordered_map<std::string, uint32_t> pattern_by_text;
  constexpr uint32_t kDropped = UINT32_MAX;
  // The configurations of each path, in queue and list order.
  std::unordered_map<std::string, std::vector<IndexEntry>> by_path;
  for (size_t queue = 0; queue < queues.size(); ++queue) {
    for (const MonitorQueue::MonitorQueueConfig& config : queues[queue]._configs) {
      IndexEntry entry{static_cast<uint32_t>(queue), config._mask,
                       static_cast<uint32_t>(data->pattern_ids.size()), 0};
      for (const std::string& text : config._ignore) {
        auto found = pattern_by_text.emplace(text.c_str(), kDropped);
        if (found.second) {
          auto pattern = std::make_unique<Pattern>(found.first->first);
          if (pattern->ok()) {
            found.first->second = static_cast<uint32_t>(data->patterns.size());
            data->patterns.push_back(std::move(pattern));
          }
        }
        if (found.first->second == kDropped) continue;
        data->pattern_ids.push_back(found.first->second);
        ++entry.pattern_count;
      }
      by_path[config._path].push_back(entry);
    }
  }
  data->nodes.reserve(by_path.size());
  for (const auto& [path, entries] : by_path) {
    data->nodes.push_back({path, Hash(path), 0, 0, static_cast<uint32_t>(entries.size())});
  }
  std::sort(data->nodes.begin(), data->nodes.end(),
            [](const IndexNode& a, const IndexNode& b) { return a.path < b.path; });
  size_t slots = 1;
  while (slots < 2 * data->nodes.size()) slots *= 2;
  data->slots.assign(data->nodes.empty() ? 0 : slots, 0);
  for (size_t i = 0; i < data->nodes.size(); ++i) {
    IndexNode& node = data->nodes[i];
    node.first_entry = static_cast<uint32_t>(data->entries.size());
    for (const IndexEntry& entry : by_path[node.path]) {
      node.mask |= entry.mask;
      data->entries.push_back(entry);
    }
    size_t slot = node.hash & (slots - 1);
    while (data->slots[slot] != 0) slot = (slot + 1) & (slots - 1);
    data->slots[slot] = static_cast<uint32_t>(i + 1);
  }
  data_ = std::move(data);
}

void MonitorQueueIndex::Match(const std::string& path, unsigned int mask,
                              std::vector<size_t>& out) const {
  out.clear();
  if (mask == 0) return;  // no configuration shares a bit with it
  const MonitorQueueIndexData& data = *data_;
  // One lookup of the thread's scratch, not one per use inside the loops.
  Scratch& scratch = g_match_scratch;
  scratch.Begin(data.patterns.size(), data.queues);
  const uint32_t call = scratch.call;
  data.ForEachAncestor(path, [&](const IndexNode& node) {
    if ((node.mask & mask) == 0) return;
    for (uint32_t e = node.first_entry; e < node.first_entry + node.entry_count; ++e) {
      const IndexEntry& entry = data.entries[e];
      if ((entry.mask & mask) == 0 || scratch.queue_stamp[entry.queue] == call) continue;
      bool ignored = false;
      for (uint32_t p = entry.first_pattern;
           p < entry.first_pattern + entry.pattern_count && !ignored; ++p) {
        const uint32_t id = data.pattern_ids[p];
        if (scratch.pattern_stamp[id] != call) {
          scratch.pattern_stamp[id] = call;
          scratch.pattern_matched[id] = data.patterns[id]->Matches(path.c_str());
        }
        ignored = scratch.pattern_matched[id] != 0;
      }
      if (ignored) continue;
      scratch.queue_stamp[entry.queue] = call;
      out.push_back(entry.queue);
    }
  });
  std::sort(out.begin(), out.end());
}

unsigned int MonitorQueueIndex::GetUnionMask(const std::string& dir) const {
  // Configuration path C is selected when C + "/" begins with dir + "/":
  // C is dir itself or begins with dir + "/".
  const std::vector<IndexNode>& nodes = data_->nodes;
  const std::string below = dir + "/";
  unsigned int mask = 0;
  const auto by_path = [](const IndexNode& node, const std::string& path) {
    return node.path < path;
  };
  const auto same = std::lower_bound(nodes.begin(), nodes.end(), dir, by_path);
  if (same != nodes.end() && same->path == dir) mask |= same->mask;
  for (auto it = std::lower_bound(nodes.begin(), nodes.end(), below, by_path);
       it != nodes.end() && it->path.compare(0, below.size(), below) == 0; ++it) {
    mask |= it->mask;
  }
  return mask;
}

bool MonitorQueueIndex::IsDirMonitoring(const std::string& dir) const {
  const std::vector<IndexNode>& nodes = data_->nodes;
  const auto by_path = [](const IndexNode& node, const std::string& path) {
    return node.path < path;
  };
  // Some configuration path begins with |prefix|.
  const auto any_below = [&](const std::string& prefix) {
    const auto it = std::lower_bound(nodes.begin(), nodes.end(), prefix, by_path);
    return it != nodes.end() && it->path.compare(0, prefix.size(), prefix) == 0;
  };
  // A directory given with a trailing "/" already carries its boundary.
  if (!dir.empty() && dir.back() == '/') return any_below(dir);
  const auto same = std::lower_bound(nodes.begin(), nodes.end(), dir, by_path);
  return (same != nodes.end() && same->path == dir) || any_below(dir + "/");
}

unsigned int MonitorQueueIndex::GetWatchMask(const std::string& dir) const {
  unsigned int mask = 0;
  data_->ForEachAncestor(dir, [&mask](const IndexNode& node) { mask |= node.mask; });
  return mask;
}

size_t MonitorQueueIndex::size() const { return data_->queues; }

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
