// The fast reader of queue files: a recursive-descent parser of the subset,
// writing the records' members in place.

#include "monitor_queue/queue_file_parser.h"

#include <stdint.h>

#include <deque>
#include <exception>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace ZORV {
namespace ZORVNOTIFYD {

namespace {

using Config = MonitorQueue::MonitorQueueConfig;

bool IsSpace(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; }

// Reads one text from its start.  Every function returns false at the
// first byte outside the subset, leaving the position anywhere.
class Parser {
 public:
  Parser(const char* text, size_t size) : p_(text), end_(text + size) {}

  // The whole text: the array, then whitespace to the end.
  bool File(std::deque<MonitorQueue>& queues) {
    const bool ok = Array([&] {
      queues.emplace_back(Json::Value::nullSingleton());  // name "", no configurations
      return Queue(queues.back());
    });
    return ok && Peek() == '\0' && p_ == end_;
  }

 private:
  // Skips whitespace; returns the byte there, or '\0' at the end.
  char Peek() {
    while (p_ != end_ && IsSpace(*p_)) ++p_;
    return p_ != end_ ? *p_ : '\0';
  }

  // Skips whitespace and the byte |c|, which must be there.
  bool Take(char c) {
    if (Peek() != c) return false;
    ++p_;
    return true;
  }

  // "[", elements separated by ",", "]"; |element| reads one.
  template <typename Element>
  bool Array(Element element) {
    if (!Take('[')) return false;
    if (Take(']')) return true;
    do {
      if (!element()) return false;
    } while (Take(','));
    return Take(']');
  }

  // "{", members separated by ",", "}"; |member| reads the value of a key.
  template <typename Member>
  bool Object(Member member) {
    if (!Take('{')) return false;
    if (Take('}')) return true;
    do {
      std::string_view key;
      if (!Key(key) || !Take(':') || !member(key)) return false;
    } while (Take(','));
    return Take('}');
  }

  // A key without escapes: an escape never yields the letters of a key the
  // subset has, so a key with one is refused as any unknown key is.
  bool Key(std::string_view& key) {
    if (!Take('"')) return false;
    const char* begin = p_;
    while (p_ != end_ && *p_ != '"' && *p_ != '\\' && *p_ != '\0') ++p_;
    if (p_ == end_ || *p_ != '"') return false;
    key = std::string_view(begin, static_cast<size_t>(p_ - begin));
    ++p_;
    return true;
  }

  // A string, appended to |out|.
  bool String(std::string& out) {
    if (!Take('"')) return false;
    for (;;) {
      const char* run = p_;
      while (p_ != end_ && *p_ != '"' && *p_ != '\\' && *p_ != '\0') ++p_;
      out.append(run, static_cast<size_t>(p_ - run));
      if (p_ == end_ || *p_ == '\0') return false;
      if (*p_++ == '"') return true;
      if (p_ == end_) return false;
      // The escaped letters and what each stands for; \u, or anything else
      // after a backslash, is refused.
      static constexpr std::string_view kEscaped = "\"\\/bfnrt";
      static constexpr std::string_view kMeant = "\"\\/\b\f\n\r\t";
      const size_t at = kEscaped.find(*p_++);
      if (at == std::string_view::npos) return false;
      out.push_back(kMeant[at]);
    }
  }

  // Digits of a value up to 4294967295, "0" or without a leading zero,
  // followed by whitespace, "," or "}" (so no fraction or exponent).
  bool Mask(unsigned int& mask) {
    const char first = Peek();
    if (first < '0' || first > '9') return false;
    uint64_t value = 0;
    if (first == '0') {
      ++p_;
    } else {
      while (p_ != end_ && *p_ >= '0' && *p_ <= '9') {
        value = value * 10 + static_cast<unsigned>(*p_++ - '0');
        if (value > UINT32_MAX) return false;
      }
    }
    if (p_ == end_ || !(IsSpace(*p_) || *p_ == ',' || *p_ == '}')) return false;
    mask = static_cast<unsigned int>(value);
    return true;
  }

  // A queue object into |queue|, which is empty.
  bool Queue(MonitorQueue& queue) {
    bool named = false;
    bool configured = false;
    return Object([&](std::string_view key) {
      if (key == "queue" && !named) {
        named = true;
        return String(queue._name);
      }
      if (key == "config" && !configured) {
        configured = true;
        configs_.clear();
        if (!Array([&] {
              configs_.emplace_back(Json::Value::nullSingleton());  // "", 0, no patterns
              return Configuration(configs_.back());
            })) {
          return false;
        }
        MoveExactly(configs_, queue._configs);
        return true;
      }
      return false;  // another key, or one seen before
    });
  }

  // A configuration object into |config|, which is empty.
  bool Configuration(Config& config) {
    bool has_path = false;
    bool has_mask = false;
    bool has_ignore = false;
    return Object([&](std::string_view key) {
      if (key == "path" && !has_path) {
        has_path = true;
        return String(config._path);
      }
      if (key == "mask" && !has_mask) {
        has_mask = true;
        return Mask(config._mask);
      }
      if (key == "ignore" && !has_ignore) {
        has_ignore = true;
        patterns_.clear();
        if (!Array([&] {
              patterns_.emplace_back();
              return String(patterns_.back());
            })) {
          return false;
        }
        MoveExactly(patterns_, config._ignore);
        return true;
      }
      return false;
    });
  }

  // Moves the elements of |from| into the empty |to|, which gets room for
  // just them: |from| keeps its room for the next list, where growing
  // |to| element by element would allocate and move it several times.
  template <typename T>
  static void MoveExactly(std::vector<T>& from, std::vector<T>& to) {
    to.reserve(from.size());
    for (T& element : from) to.push_back(std::move(element));
    from.clear();
  }

  const char* p_;
  const char* const end_;
  std::vector<Config> configs_;        // the configurations of the queue being read
  std::vector<std::string> patterns_;  // the patterns of the configuration being read
};

}  // namespace

bool ParseQueueFileSubset(const char* text, size_t size, std::vector<MonitorQueue>& queues) {
  try {
    // Built apart, in a deque, which never copies a queue as it grows (a
    // MonitorQueue has no move), so that a refused text leaves |queues| as
    // it was, capacity included.
    std::deque<MonitorQueue> parsed;
    if (!Parser(text, size).File(parsed)) return false;
    queues.reserve(queues.size() + parsed.size());
    for (MonitorQueue& queue : parsed) {  // nothing below allocates
      queues.emplace_back(Json::Value::nullSingleton());
      queues.back()._name.swap(queue._name);
      queues.back()._configs.swap(queue._configs);
    }
    return true;
  } catch (const std::exception&) {
    return false;  // out of memory: the JSON reader decides, as for any refused text
  }
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
