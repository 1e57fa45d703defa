// The catalogue-wide index: configurations grouped by path, found by a hash
// of each prefix of the asked path, and ignore patterns compiled once per
// distinct text.

#include "monitor_queue_index.h"

#include <regex.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <map>
#include <unordered_map>
#include <utility>

#include "monitor_queue/literal_pattern.h"

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

// One compiled pattern, freed exactly once, and its literal form when it has
// one (then byte comparisons answer in place of regexec).
class Pattern {
 public:
  // Compiles |text| as PrepareRegex does; ok() tells whether it compiled.
  explicit Pattern(const std::string& text)
      : ok_(regcomp(&regex_, text.c_str(), REG_EXTENDED) == 0),
        literal_ok_(ok_ && literal_.Parse(text.c_str())) {}
  ~Pattern() {
    if (ok_) regfree(&regex_);
  }
  Pattern(const Pattern&) = delete;
  Pattern& operator=(const Pattern&) = delete;
  bool ok() const { return ok_; }
  // True when the pattern matches |subject| (regexec result 0).
  template <typename Subject>
  bool Matches(Subject& subject) const {
    if (literal_ok_ && subject.LiteralsAnswer()) {
      return literal_.Matches(subject.path.c_str(), subject.length);
    }
    return regexec(&regex_, subject.path.c_str(), 0, nullptr, 0) == 0;
  }

 private:
  regex_t regex_;
  bool ok_;
  LiteralPattern literal_;
  bool literal_ok_;
};

// The asked path as the patterns see it: the bytes regexec reads (up to a
// NUL byte), measured once, on the first literal pattern that runs.
struct Subject {
  static constexpr size_t kUnmeasured = SIZE_MAX, kByRegexec = SIZE_MAX - 1;
  const std::string& path;
  size_t length = kUnmeasured;

  // True when literal patterns may answer in the calling thread's locale;
  // |length| is then measured.
  bool LiteralsAnswer() {
    if (length == kUnmeasured) {
      length = LiteralAnswersHere() ? std::strlen(path.c_str()) : kByRegexec;
    }
    return length != kByRegexec;
  }
};

// Match remembers the answers of at most this many patterns per call, on the
// stack; a pattern beyond them runs once per group that names it.
constexpr uint32_t kMemoSlots = 512;
constexpr size_t kMemoWords = kMemoSlots / 64;

}  // namespace

// A pattern as a group names it: which one, and where Match remembers its
// answer.  Slots are numbered along each chain of ancestors (a node's
// patterns that its ancestors do not name come after theirs), so that one
// pattern has one slot on every path that reaches it.
struct PatternRef {
  uint32_t id;    // into MonitorQueueIndexData::patterns
  uint32_t slot;  // below the node's chain_slots
};

// The configurations of one path with the same mask and the same set of
// compiled patterns: they want exactly the same events, so they answer as
// one and hand out their queues together.
struct IndexGroup {
  unsigned int mask;
  uint32_t first_ref;  // into MonitorQueueIndexData::refs
  uint32_t ref_count;
  uint32_t first_queue;  // into MonitorQueueIndexData::queue_ids: ascending, each once
  uint32_t queue_count;
};

// All configurations with one path.
struct IndexNode {
  std::string path;
  uint64_t hash;
  unsigned int mask;  // the OR of the groups' masks
  uint32_t first_group;
  uint32_t group_count;
};

struct MonitorQueueIndexData {
  size_t queues = 0;
  std::vector<IndexNode> nodes;  // sorted by path
  std::vector<IndexGroup> groups;
  std::vector<PatternRef> refs;
  std::vector<uint32_t> queue_ids;
  std::vector<std::unique_ptr<Pattern>> patterns;
  size_t memo_words = 0;        // the 64-bit words of Match's memo that slots reach
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
  // For each path, the queues of each (mask, set of compiled patterns), in
  // queue order.
  using GroupKey = std::pair<unsigned int, std::vector<uint32_t>>;
  std::unordered_map<std::string, std::map<GroupKey, std::vector<uint32_t>>> by_path;
  for (size_t queue = 0; queue < queues.size(); ++queue) {
    for (const MonitorQueue::MonitorQueueConfig& config : queues[queue]._configs) {
      GroupKey key{config._mask, {}};
      for (const std::string& text : config._ignore) {
        // Looked up before it is added: most patterns recur across
        // configurations, and an insertion attempt costs a node each time.
        std::string seen(text.c_str());
        auto found = pattern_by_text.find(seen);
        if (found == pattern_by_text.end()) {
          found = pattern_by_text.emplace(std::move(seen), kDropped).first;
          auto pattern = std::make_unique<Pattern>(found->first);
          if (pattern->ok()) {
            found->second = static_cast<uint32_t>(data->patterns.size());
            data->patterns.push_back(std::move(pattern));
          }
        }
        if (found->second != kDropped) key.second.push_back(found->second);
      }
      // Whether the patterns ignore a path depends neither on their order
      // nor on how often one is named.
      std::sort(key.second.begin(), key.second.end());
      key.second.erase(std::unique(key.second.begin(), key.second.end()), key.second.end());
      std::vector<uint32_t>& members = by_path[config._path][key];
      if (members.empty() || members.back() != queue) {
        members.push_back(static_cast<uint32_t>(queue));
      }
    }
  }
  // The paths sorted by reference, each node then made once in its place
  // (sorting the nodes would move their strings at every swap), with its
  // groups at hand without a second lookup of its path.
  std::vector<const decltype(by_path)::value_type*> sorted;
  sorted.reserve(by_path.size());
  for (const auto& entry : by_path) sorted.push_back(&entry);
  std::sort(sorted.begin(), sorted.end(),
            [](const auto* a, const auto* b) { return a->first < b->first; });
  data->nodes.reserve(sorted.size());
  for (const auto* entry : sorted) {
    data->nodes.push_back({entry->first, Hash(entry->first), 0, 0, 0});
  }
  size_t slots = 1;
  while (slots < 2 * data->nodes.size()) slots *= 2;
  data->slots.assign(data->nodes.empty() ? 0 : slots, 0);
  for (size_t i = 0; i < data->nodes.size(); ++i) {
    size_t slot = data->nodes[i].hash & (slots - 1);
    while (data->slots[slot] != 0) slot = (slot + 1) & (slots - 1);
    data->slots[slot] = static_cast<uint32_t>(i + 1);
  }
  // Memo slots, node by node in path order (an ancestor sorts before its
  // descendants): the nearest ancestor's chain first, then the patterns
  // this node adds, kept in |added|.
  constexpr uint32_t kNone = UINT32_MAX;
  std::vector<std::vector<PatternRef>> added(data->nodes.size());
  std::vector<uint32_t> parent(data->nodes.size(), kNone);
  std::vector<uint32_t> chain_slots(data->nodes.size(), 0);
  uint32_t most_slots = 0;
  for (size_t i = 0; i < data->nodes.size(); ++i) {
    IndexNode& node = data->nodes[i];
    data->ForEachAncestor(node.path, [&](const IndexNode& ancestor) {
      const uint32_t at = static_cast<uint32_t>(&ancestor - data->nodes.data());
      if (at != i) parent[i] = at;  // the last one before the node itself
    });
    chain_slots[i] = parent[i] == kNone ? 0 : chain_slots[parent[i]];
    // The slot of pattern |id| on this node's chain, added when new.
    const auto slot_of = [&](uint32_t id) {
      for (uint32_t n = static_cast<uint32_t>(i); n != kNone; n = parent[n]) {
        for (const PatternRef& ref : added[n]) {
          if (ref.id == id) return ref.slot;
        }
      }
      added[i].push_back({id, chain_slots[i]});
      return chain_slots[i]++;
    };
    node.first_group = static_cast<uint32_t>(data->groups.size());
    for (const auto& [key, members] : sorted[i]->second) {
      const IndexGroup group{key.first, static_cast<uint32_t>(data->refs.size()),
                             static_cast<uint32_t>(key.second.size()),
                             static_cast<uint32_t>(data->queue_ids.size()),
                             static_cast<uint32_t>(members.size())};
      for (uint32_t id : key.second) data->refs.push_back({id, slot_of(id)});
      data->queue_ids.insert(data->queue_ids.end(), members.begin(), members.end());
      node.mask |= group.mask;
      data->groups.push_back(group);
    }
    node.group_count = static_cast<uint32_t>(data->groups.size()) - node.first_group;
    most_slots = std::max(most_slots, chain_slots[i]);
  }
  data->memo_words = (std::min(most_slots, kMemoSlots) + 63) / 64;
  data_ = std::move(data);
}

void MonitorQueueIndex::Match(const std::string& path, unsigned int mask,
                              std::vector<size_t>& out) const {
  out.clear();
  if (mask == 0) return;  // no configuration shares a bit with it
  const MonitorQueueIndexData& data = *data_;
  // Which patterns ran during this call, and which of those matched.
  uint64_t ran[kMemoWords], matched[kMemoWords];
  std::fill_n(ran, data.memo_words, 0);
  std::fill_n(matched, data.memo_words, 0);
  Subject subject{path};
  const auto ignored = [&](const IndexGroup& group) {
    for (uint32_t r = group.first_ref; r < group.first_ref + group.ref_count; ++r) {
      const PatternRef& ref = data.refs[r];
      const Pattern& pattern = *data.patterns[ref.id];
      if (ref.slot >= kMemoSlots) {
        if (pattern.Matches(subject)) return true;
        continue;
      }
      const uint64_t bit = uint64_t{1} << (ref.slot % 64);
      if ((ran[ref.slot / 64] & bit) == 0) {
        ran[ref.slot / 64] |= bit;
        if (pattern.Matches(subject)) matched[ref.slot / 64] |= bit;
      }
      if (matched[ref.slot / 64] & bit) return true;
    }
    return false;
  };
  size_t answering = 0;  // groups whose queues went into |out|
  data.ForEachAncestor(path, [&](const IndexNode& node) {
    if ((node.mask & mask) == 0) return;
    for (uint32_t g = node.first_group; g < node.first_group + node.group_count; ++g) {
      const IndexGroup& group = data.groups[g];
      if ((group.mask & mask) == 0 || ignored(group)) continue;
      out.insert(out.end(), data.queue_ids.begin() + group.first_queue,
                 data.queue_ids.begin() + group.first_queue + group.queue_count);
      ++answering;
    }
  });
  // One group's queues are ascending and each once already; several groups
  // may name the same queue.
  if (answering > 1) {
    std::sort(out.begin(), out.end());
    out.erase(std::unique(out.begin(), out.end()), out.end());
  }
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
