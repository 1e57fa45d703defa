// MonitorQueueIndex against the plain questions asked of every queue, on
// generated catalogues full of the paths the boundary rules single out.

#include "monitor_queue_index.h"

#include <atomic>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

namespace {

using namespace ZORV::ZORVNOTIFYD;  // NOLINT

// Paths of up to |max| tokens: empty, relative, with trailing and doubled
// "/", nested in one another.
std::string RandomPath(std::mt19937& random, int max) {
  static const char* const kTokens[] = {"/", "/", "a", "b", "/a", "ab"};
  std::string path;
  for (int n = std::uniform_int_distribution<int>(0, max)(random); n > 0; --n) {
    path += kTokens[random() % 6];
  }
  return path;
}

std::vector<MonitorQueue> RandomCatalogue(std::mt19937& random, int queues) {
  // Patterns that match, do not, are anchored, and do not compile; literal
  // shapes and a near miss.
  static const char* const kPatterns[] = {"a$",  "^/a/", "b",       "[",  "/$",
                                          "^/b", "(a",   "/a(/|$)", "a.b"};
  std::vector<MonitorQueue> catalogue;
  for (int q = 0; q < queues; ++q) {
    Json::Value json;
    json["queue"] = "q" + std::to_string(q);
    for (int c = int(random() % 4); c > 0; --c) {
      Json::Value config;
      config["path"] = RandomPath(random, 4);
      config["mask"] = Json::UInt(random() % 8);
      for (int p = int(random() % 3); p > 0; --p) config["ignore"].append(kPatterns[random() % 9]);
      json["config"].append(config);
      if (random() % 3 == 0) json["config"].append(config);  // twice in one queue
    }
    catalogue.emplace_back(json);
  }
  return catalogue;
}

// What the index must answer for (path, mask), asked of every queue.
std::vector<size_t> Loop(std::vector<MonitorQueue>& queues, const std::string& path,
                         unsigned mask) {
  std::vector<size_t> wanted;
  for (size_t i = 0; i < queues.size(); ++i) {
    if (queues[i].IsMonitoring(path, mask)) wanted.push_back(i);
  }
  return wanted;
}

TEST(MonitorQueueIndexTest, AnswersExactlyAsThePlainCalls) {
  std::mt19937 random(20261123);
  for (int round = 0; round < 40; ++round) {
    std::vector<MonitorQueue> queues = RandomCatalogue(random, round % 12);  // 0: empty
    const MonitorQueueIndex index = [&] {
      std::vector<MonitorQueue> scratch = queues;  // gone before the index is asked
      return MonitorQueueIndex(scratch);
    }();
    ASSERT_EQ(index.size(), queues.size());
    std::vector<size_t> got = {99};  // cleared by Match
    for (int i = 0; i < 200; ++i) {
      const std::string path = RandomPath(random, 7);
      for (unsigned mask = 0; mask < 8; ++mask) {
        index.Match(path, mask, got);
        ASSERT_EQ(got, Loop(queues, path, mask)) << "path \"" << path << "\" mask " << mask;
      }
      unsigned union_mask = 0, watch_mask = 0;
      for (const MonitorQueue& queue : queues) {
        union_mask |= queue.GetUnionMask(path);
        for (const auto& config : queue._configs) {
          const std::string& c = config._path;
          if (path.compare(0, c.size(), c) == 0 &&
              (path.size() == c.size() || path[c.size()] == '/')) {
            watch_mask |= config._mask;
          }
        }
      }
      ASSERT_EQ(index.GetUnionMask(path), union_mask) << path;
      ASSERT_EQ(index.IsDirMonitoring(path), MonitorQueue::IsDirMonitoring(queues, path)) << path;
      ASSERT_EQ(index.GetWatchMask(path), watch_mask) << path;
    }
  }
  // More distinct patterns on one path than Match remembers answers for:
  // the last ones, past the memo, still decide.
  Json::Value json;
  json["config"][0]["path"] = "/p";
  json["config"][0]["mask"] = 1;
  for (int p = 0; p < 600; ++p) json["config"][0]["ignore"].append("x" + std::to_string(p) + "$");
  std::vector<MonitorQueue> many = {MonitorQueue(json), MonitorQueue(json)};
  many[1]._configs[0]._ignore.push_back("a$");
  std::vector<size_t> got;
  for (const char* path : {"/p/a", "/p/x599", "/p/x5990", "/p/x0"}) {
    MonitorQueueIndex(many).Match(path, 1, got);
    EXPECT_EQ(got, Loop(many, path, 1)) << path;
  }
}

// One index, and copies of it, asked from several threads at once (the
// ThreadSanitizer build runs this too).
TEST(MonitorQueueIndexTest, AnswersFromSeveralThreadsAtOnce) {
  std::mt19937 random(7);
  std::vector<MonitorQueue> queues = RandomCatalogue(random, 50);
  std::vector<std::string> paths;
  std::vector<std::vector<size_t>> expected;
  for (int i = 0; i < 300; ++i) {
    paths.push_back(RandomPath(random, 7));
    expected.push_back(Loop(queues, paths.back(), 7));
  }
  const MonitorQueueIndex index(queues);
  std::atomic<int> wrong{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, copy = index] {
      std::vector<size_t> got;
      for (int round = 0; round < 20; ++round) {
        for (size_t i = 0; i < paths.size(); ++i) {
          (round % 2 ? copy : index).Match(paths[i], 7, got);
          if (got != expected[i]) ++wrong;
        }
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(wrong.load(), 0);
}

}  // namespace
