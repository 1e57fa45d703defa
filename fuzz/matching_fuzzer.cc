// Fuzz target: the matching questions on arbitrary configurations and paths,
// checked against a deliberately simple reference of the rules written here.
//
// The bytes give up to four queues of up to four configurations each (path,
// mask, ignore patterns) and then a series of questions.  Paths are drawn
// mostly from "/", "a", "b" and "." so that prefixes and boundaries meet
// often, with any other byte now and then.  Every answer of the library is
// compared with the reference, and so is the prepared state of every
// configuration (compiled on the first call that passes the mask and path
// tests, never earlier).  A third of the patterns have the shapes that
// LiteralPattern answers without the regex engine, or nearly: each question
// also sets LiteralPattern against regexec on every pattern of the queue and
// the question's path.  Inputs of odd length run in the C.UTF-8 locale,
// the others in the C locale.

#include <locale.h>
#include <regex.h>

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <set>
#include <string>
#include <vector>

#include <fuzzer/FuzzedDataProvider.h>

#include "fuzz_common.h"
#include "monitor_queue.h"
#include "monitor_queue/literal_pattern.h"

using ZORV::ZORVNOTIFYD::MonitorQueue;
using Config = ZORV::ZORVNOTIFYD::MonitorQueue::MonitorQueueConfig;

namespace {

// ---- The reference: the rules as plainly as they can be written. ----

bool StartsWith(const std::string& text, const std::string& prefix) {
  return text.substr(0, prefix.size()) == prefix;
}

// Does any ignore pattern, compiled afresh, match somewhere in the path?
bool Ignored(const std::vector<std::string>& patterns, const std::string& path) {
  for (const std::string& pattern : patterns) {
    regex_t regex;
    if (regcomp(&regex, pattern.c_str(), REG_EXTENDED) != 0) continue;
    const bool match = regexec(&regex, path.c_str(), 0, nullptr, 0) == 0;
    regfree(&regex);
    if (match) return true;
  }
  return false;
}

bool PassesMaskAndPath(const Config& config, const std::string& path, unsigned mask) {
  if ((mask & config._mask) == 0) return false;
  if (!StartsWith(path, config._path)) return false;
  return path == config._path || path[config._path.size()] == '/';
}

bool RefWants(const Config& config, const std::string& path, unsigned mask) {
  return PassesMaskAndPath(config, path, mask) && !Ignored(config._ignore, path);
}

bool RefDir(const Config& config, const std::string& dir) {
  if (!StartsWith(config._path, dir)) return false;
  if (!dir.empty() && dir.back() == '/') return true;
  return config._path == dir || config._path[dir.size()] == '/';
}

unsigned RefUnionMask(const MonitorQueue& queue, const std::string& dir) {
  unsigned mask = 0;
  for (const Config& config : queue._configs) {
    if (StartsWith(config._path + "/", dir + "/")) mask |= config._mask;
  }
  return mask;
}

// "/vol/share/x" -> {"", "vol", "share", "x"}: n separators give n + 1 fields.
std::vector<std::string> Split(const std::string& path) {
  std::vector<std::string> fields(1);
  for (char c : path) {
    if (c == '/') {
      fields.emplace_back();
    } else {
      fields.back().push_back(c);
    }
  }
  return fields;
}

void RefShares(const MonitorQueue& queue, std::set<std::string>& shares) {
  for (const Config& config : queue._configs) {
    const std::vector<std::string> fields = Split(config._path);
    // Absolute (the first field is empty) with at least two components.
    if (config._path.empty() || !fields[0].empty() || fields.size() < 3) continue;
    shares.insert("/" + fields[1] + "/" + fields[2]);
  }
}

// ---- Building the input. ----

std::string Path(FuzzedDataProvider& input) { return zorv_fuzz::Path(input, 24); }

// A pattern of a literal shape or a near miss, chosen by the bytes of |raw|:
// an optional "^", a piece per byte (literal bytes, escapes glibc reads as
// the byte and escapes it reads as anchors or classes, operators, a byte of
// UTF-8, a control byte) and an ending.  No group nests and at most two
// operators repeat, so it compiles quickly.
std::string LiteralShaped(const std::string& raw) {
  static const char* const kPieces[] = {
      "a",    "b",   "/",   "~",   "-",   "\\.", "\\\\", "\\$", "\\^",  "\\(",
      "\\/",  "\\<", "\\'", "\\w", "\\b", ".",   "*",    "+",   "[ab]", "\xc3\xa9",
      "\x01", "$",   "^",   "|",   " ",   "ab",  "/a",   "\\{", "{",    ")",
  };
  static const char* const kEndings[] = {"",    "$",     "(/|$)", "($|/)", "(/|$)a",
                                         "(/)", "(/|^)", "\\",    "$$",    "(/|$"};
  const auto byte = [&raw](size_t i) { return static_cast<unsigned char>(raw[i]); };
  std::string pattern = (byte(0) / 3) % 2 ? "^" : "";
  int operators = 0;
  for (size_t i = 1; i + 1 < raw.size(); ++i) {
    const char* piece = kPieces[byte(i) % (sizeof kPieces / sizeof kPieces[0])];
    if (std::strchr("*+{", piece[0]) && ++operators > 2) piece = "a";
    pattern += piece;
  }
  return pattern + kEndings[byte(raw.size() - 1) % (sizeof kEndings / sizeof kEndings[0])];
}

// Patterns of up to twelve bytes from an alphabet without "{" and "\\", with at most two
// repetition operators and one group: glibc's regcomp takes time exponential in nested
// repetitions ("((a*)*)*..."), which would report a slow compile, not a fault, as a timeout.
// A third of them (by their first byte) are literal shapes instead.
std::string Pattern(FuzzedDataProvider& input) {
  static const char kAlphabet[] = "ab/.*+?|()[]^$-";
  std::string pattern = input.ConsumeRandomLengthString(12);
  if (!pattern.empty() && static_cast<unsigned char>(pattern[0]) % 3 == 0) {
    return LiteralShaped(pattern);
  }
  int repetitions = 0;
  int groups = 0;
  for (char& c : pattern) {
    c = kAlphabet[static_cast<unsigned char>(c) % (sizeof kAlphabet - 1)];
    if ((c == '*' || c == '+' || c == '?') && ++repetitions > 2) c = 'a';
    if (c == '(' && ++groups > 1) c = 'b';
  }
  return pattern;
}

MonitorQueue Queue(FuzzedDataProvider& input) {
  return zorv_fuzz::RandomQueue(input, 24, [&] { return Pattern(input); });
}

[[noreturn]] void Mismatch(const char* question, const std::string& argument, long got,
                           long expected) {
  std::fprintf(stderr, "%s(\"%s\"): library %ld, reference %ld\n", question, argument.c_str(), got,
               expected);
  std::abort();
}

// When LiteralPattern takes |pattern|, its answer on |path| must be regexec's
// on the same pattern compiled as the library compiles it.
void CheckLiteral(const std::string& pattern, const std::string& path) {
  ZORV::ZORVNOTIFYD::LiteralPattern literal;
  if (!literal.Parse(pattern.c_str())) return;
  if (!ZORV::ZORVNOTIFYD::LiteralAnswersHere()) Mismatch("LiteralAnswersHere", pattern, 0, 1);
  regex_t regex;
  if (regcomp(&regex, pattern.c_str(), REG_EXTENDED) != 0) {
    Mismatch("regcomp of a literal pattern", pattern, 1, 0);
  }
  const bool expected = regexec(&regex, path.c_str(), 0, nullptr, 0) == 0;
  regfree(&regex);
  const bool got = literal.Matches(path.c_str(), std::strlen(path.c_str()));
  if (got != expected)
    Mismatch(("LiteralPattern \"" + pattern + "\"").c_str(), path, got, expected);
}

// The prepared state the library must show, tracked beside each queue.
struct Tracked {
  MonitorQueue queue;
  std::vector<bool> reached;  // a call passed the mask and path tests
};

void CheckPrepared(const Tracked& tracked) {
  for (size_t i = 0; i < tracked.queue._configs.size(); ++i) {
    const Config& config = tracked.queue._configs[i];
    if (config._prepared != tracked.reached[i]) {
      Mismatch("prepared state", config._path, config._prepared, tracked.reached[i]);
    }
    size_t compilable = 0;
    for (const std::string& pattern : config._ignore) {
      regex_t regex;
      if (regcomp(&regex, pattern.c_str(), REG_EXTENDED) != 0) continue;
      regfree(&regex);
      ++compilable;
    }
    const size_t expected = config._prepared ? compilable : 0;
    if (config._regexes.size() != expected) {
      Mismatch("compiled patterns", config._path, static_cast<long>(config._regexes.size()),
               static_cast<long>(expected));
    }
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const locale_t utf8 = newlocale(LC_ALL_MASK, "C.UTF-8", nullptr);
  zorv_fuzz::Check(utf8 != nullptr, "the C.UTF-8 locale is installed");
  uselocale(size % 2 ? utf8 : LC_GLOBAL_LOCALE);
  FuzzedDataProvider input(data, size);
  std::vector<Tracked> tracked;
  const int queues = input.ConsumeIntegralInRange(1, 4);
  for (int i = 0; i < queues; ++i) {
    MonitorQueue queue = Queue(input);
    const size_t configs = queue._configs.size();
    tracked.push_back(Tracked{queue, std::vector<bool>(configs, false)});
  }

  for (int question = 0; question < 16 && input.remaining_bytes() > 0; ++question) {
    const int which = input.ConsumeIntegralInRange(0, 4);
    Tracked& one = tracked[input.ConsumeIntegralInRange<size_t>(0, tracked.size() - 1)];
    MonitorQueue& queue = one.queue;
    const std::string path = Path(input);
    for (const Config& config : queue._configs) {
      for (const std::string& pattern : config._ignore) CheckLiteral(pattern, path);
    }
    switch (which) {
      case 0: {  // IsMonitoring, queue form: the first configuration that wants it decides
        const unsigned mask = zorv_fuzz::Mask(input);
        bool expected = false;
        for (size_t i = 0; i < queue._configs.size() && !expected; ++i) {
          if (PassesMaskAndPath(queue._configs[i], path, mask)) one.reached[i] = true;
          expected = RefWants(queue._configs[i], path, mask);
        }
        const bool got = queue.IsMonitoring(path, mask);
        if (got != expected) Mismatch("MonitorQueue::IsMonitoring", path, got, expected);
        break;
      }
      case 1: {  // IsMonitoring, configuration form
        if (queue._configs.empty()) break;
        const size_t i = input.ConsumeIntegralInRange<size_t>(0, queue._configs.size() - 1);
        const unsigned mask = zorv_fuzz::Mask(input);
        Config& config = queue._configs[i];
        if (PassesMaskAndPath(config, path, mask)) one.reached[i] = true;
        const bool expected = RefWants(config, path, mask);
        const bool got = config.IsMonitoring(path, mask);
        if (got != expected) Mismatch("MonitorQueueConfig::IsMonitoring", path, got, expected);
        break;
      }
      case 2: {  // IsDirMonitoring: configuration, queue and list forms
        bool any_in_queue = false;
        for (const Config& config : queue._configs) {
          const bool expected = RefDir(config, path);
          if (config.IsDirMonitoring(path) != expected) {
            Mismatch("MonitorQueueConfig::IsDirMonitoring", path, !expected, expected);
          }
          any_in_queue = any_in_queue || expected;
        }
        if (queue.IsDirMonitoring(path) != any_in_queue) {
          Mismatch("MonitorQueue::IsDirMonitoring", path, !any_in_queue, any_in_queue);
        }
        std::vector<MonitorQueue> list;
        bool any_in_list = false;
        for (const Tracked& other : tracked) {
          list.push_back(other.queue);
          for (const Config& config : other.queue._configs) {
            any_in_list = any_in_list || RefDir(config, path);
          }
        }
        if (MonitorQueue::IsDirMonitoring(list, path) != any_in_list) {
          Mismatch("static IsDirMonitoring", path, !any_in_list, any_in_list);
        }
        break;
      }
      case 3: {  // GetUnionMask
        const unsigned expected = RefUnionMask(queue, path);
        const unsigned got = queue.GetUnionMask(path);
        if (got != expected) Mismatch("GetUnionMask", path, got, expected);
        break;
      }
      default: {  // CollectShareSet on a set that already holds an entry, and GetShareSet
        std::set<std::string> shares = {path};
        std::set<std::string> expected = shares;
        RefShares(queue, expected);
        queue.CollectShareSet(shares);
        if (shares != expected) {
          Mismatch("CollectShareSet", path, static_cast<long>(shares.size()),
                   static_cast<long>(expected.size()));
        }
        std::vector<MonitorQueue> list;
        std::set<std::string> all;
        for (const Tracked& other : tracked) {
          list.push_back(other.queue);
          RefShares(other.queue, all);
        }
        if (MonitorQueue::GetShareSet(list) != all) {
          Mismatch("GetShareSet", path, static_cast<long>(MonitorQueue::GetShareSet(list).size()),
                   static_cast<long>(all.size()));
        }
        break;
      }
    }
    CheckPrepared(one);
  }
  return 0;
}
