// Fuzz target: MonitorQueueIndex against the plain calls on the queues it
// was built from.
//
// The bytes give up to eight queues of up to four configurations each and
// then a series of questions.  Paths are drawn mostly from "/", "a", "b"
// and "." (empty, relative, with trailing or doubled "/" and any other byte
// now and then), and a question's path often extends a configured path, so
// that the boundary rule is met at every depth.  Ignore patterns are often
// taken again from those already drawn, so that one compiled pattern serves
// several configurations and queues, some of them differ only after a NUL
// byte, and some do not compile.  Each answer of the index must equal the
// plain one: IsMonitoring asked of every queue, the OR of GetUnionMask, the
// static IsDirMonitoring, and the watch mask worked out configuration by
// configuration.

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include <fuzzer/FuzzedDataProvider.h>

#include "fuzz_common.h"
#include "monitor_queue_index.h"

using ZORV::ZORVNOTIFYD::MonitorQueue;
using ZORV::ZORVNOTIFYD::MonitorQueueIndex;
using Config = ZORV::ZORVNOTIFYD::MonitorQueue::MonitorQueueConfig;

namespace {

// ---- Building the input. ----

std::string Path(FuzzedDataProvider& input) { return zorv_fuzz::Path(input, 16); }

// Patterns bounded as in matching_fuzzer.cc (glibc's regcomp takes time
// exponential in nested repetitions): up to twelve bytes without "{" or
// "\\", at most two repetition operators and one group.  NUL is in the
// alphabet: regcomp sees a pattern only up to it.
std::string Pattern(FuzzedDataProvider& input, std::vector<std::string>& drawn) {
  if (!drawn.empty() && input.ConsumeBool()) {
    return drawn[input.ConsumeIntegralInRange<size_t>(0, drawn.size() - 1)];
  }
  static const char kAlphabet[] = "ab/.*+?|()[]^$-";
  std::string pattern = input.ConsumeRandomLengthString(12);
  int repetitions = 0;
  int groups = 0;
  for (char& c : pattern) {
    c = kAlphabet[static_cast<unsigned char>(c) % sizeof kAlphabet];  // the final NUL too
    if ((c == '*' || c == '+' || c == '?') && ++repetitions > 2) c = 'a';
    if (c == '(' && ++groups > 1) c = 'b';
  }
  drawn.push_back(pattern);
  return pattern;
}

MonitorQueue Queue(FuzzedDataProvider& input, std::vector<std::string>& drawn) {
  return zorv_fuzz::RandomQueue(input, 16, [&] { return Pattern(input, drawn); });
}

// A question's path: a fresh one, or a configured path with a tail.
std::string Question(FuzzedDataProvider& input, const std::vector<MonitorQueue>& queues) {
  const int queue = input.ConsumeIntegralInRange<int>(-1, static_cast<int>(queues.size()) - 1);
  if (queue < 0 || queues[queue]._configs.empty()) return Path(input);
  const std::vector<Config>& configs = queues[queue]._configs;
  const std::string& base =
      configs[input.ConsumeIntegralInRange<size_t>(0, configs.size() - 1)]._path;
  return base + Path(input);
}

// |text| with every byte outside printable ASCII written as \xHH.
std::string Escape(const std::string& text) {
  std::string escaped;
  for (char c : text) {
    const unsigned char byte = static_cast<unsigned char>(c);
    if (byte >= 0x20 && byte < 0x7f && byte != '\\') {
      escaped.push_back(c);
    } else {
      char hex[5];
      std::snprintf(hex, sizeof hex, "\\x%02x", byte);
      escaped += hex;
    }
  }
  return escaped;
}

// Reports a disagreement on the question |question| about |argument| (and
// |mask|, for Match) and stops the run.
[[noreturn]] void Mismatch(const char* question, const std::string& argument, const char* mask,
                           const std::string& got, const std::string& expected) {
  std::fprintf(stderr, "index %s(\"%s\"%s): index %s, plain calls %s\n", question,
               Escape(argument).c_str(), mask, got.c_str(), expected.c_str());
  std::abort();
}

std::string Text(unsigned long value) { return std::to_string(value); }

std::string Text(const std::vector<size_t>& positions) {
  std::string text = "{";
  for (size_t position : positions) text += " " + std::to_string(position);
  return text + " }";
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  FuzzedDataProvider input(data, size);
  std::vector<std::string> drawn;
  std::vector<MonitorQueue> queues;
  const int count = input.ConsumeIntegralInRange(0, 8);
  for (int i = 0; i < count; ++i) queues.push_back(Queue(input, drawn));

  // Built from a copy that is gone before the first question: the index
  // must keep all it needs.
  const MonitorQueueIndex index = [&queues] {
    std::vector<MonitorQueue> source = queues;
    return MonitorQueueIndex(source);
  }();
  if (index.size() != queues.size()) {
    Mismatch("size", "", "", Text(index.size()), Text(queues.size()));
  }

  std::vector<size_t> got = {~size_t{0}};  // Match must clear it first
  std::vector<size_t> expected;
  for (int question = 0; question < 32 && input.remaining_bytes() > 0; ++question) {
    const int which = input.ConsumeIntegralInRange(0, 3);
    const std::string path = Question(input, queues);
    switch (which) {
      case 0: {
        const unsigned mask = input.ConsumeBool() ? ~0u : zorv_fuzz::Mask(input);
        expected.clear();
        for (size_t i = 0; i < queues.size(); ++i) {
          if (queues[i].IsMonitoring(path, mask)) expected.push_back(i);
        }
        index.Match(path, mask, got);
        if (got != expected) {
          Mismatch("Match", path, (", mask " + Text(mask)).c_str(), Text(got), Text(expected));
        }
        break;
      }
      case 1: {
        unsigned mask = 0;
        for (const MonitorQueue& queue : queues) mask |= queue.GetUnionMask(path);
        const unsigned answer = index.GetUnionMask(path);
        if (answer != mask) Mismatch("GetUnionMask", path, "", Text(answer), Text(mask));
        break;
      }
      case 2: {
        const bool plain = MonitorQueue::IsDirMonitoring(queues, path);
        const bool answer = index.IsDirMonitoring(path);
        if (answer != plain) Mismatch("IsDirMonitoring", path, "", Text(answer), Text(plain));
        break;
      }
      default: {
        unsigned mask = 0;
        for (const MonitorQueue& queue : queues) {
          for (const Config& config : queue._configs) {
            const std::string& c = config._path;
            if (path.compare(0, c.size(), c) == 0 &&
                (path.size() == c.size() || path[c.size()] == '/')) {
              mask |= config._mask;
            }
          }
        }
        const unsigned answer = index.GetWatchMask(path);
        if (answer != mask) Mismatch("GetWatchMask", path, "", Text(answer), Text(mask));
        break;
      }
    }
  }
  return 0;
}
