// Crash safety of the store: a writer killed with SIGKILL at random moments while it saves and
// upserts leaves a queue file that loads as the list before or the list after the interrupted
// write, and the store lock free.  Only the timing of the kills is random.

#include <fcntl.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <new>
#include <random>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "support/sandbox.h"

namespace ZORV::ZORVNOTIFYD {
namespace {

constexpr int kLists = 3;  // the writer cycles through three lists

// List |k|: queue "q" with 40 * (k + 1) configurations of mask k + 1, then queue "r".
std::vector<MonitorQueue> List(int k) {
  Json::Value q;
  Json::Value r;
  q["queue"] = "q";
  r["queue"] = "r";
  for (Json::ArrayIndex i = 0; i < 40u * (k + 1); ++i) {
    q["config"][i]["path"] = "/vol/share/" + std::to_string(i);
    q["config"][i]["mask"] = k + 1;
  }
  return {MonitorQueue(q), MonitorQueue(r)};
}

Json::Value AsJson(const std::vector<MonitorQueue>& queues) {
  Json::Value array(Json::arrayValue);
  for (const MonitorQueue& queue : queues) array.append(queue.ToJson());
  return array;
}

TEST(CrashSafetyTest, KilledWriterLeavesListBeforeOrAfterAndLockFree) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  zorv_test::RemoveSystemctl();  // service requests fail at once instead of running a script
  if (prctl(PR_SET_CHILD_SUBREAPER, 1) != 0) {  // a writer's orphaned children come back here
    GTEST_SKIP() << "prctl(PR_SET_CHILD_SUBREAPER) failed: " << strerror(errno)
                 << ": the children a killed writer leaves cannot be waited for (qemu-user 7.2 "
                    "does not implement this prctl)";
  }
  void* shared = mmap(nullptr, sizeof(std::atomic<int>), PROT_READ | PROT_WRITE,
                      MAP_SHARED | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(shared, MAP_FAILED);
  auto* started = new (shared) std::atomic<int>(0);  // the writer's current step
  std::vector<MonitorQueue> lists[kLists];
  Json::Value expected[kLists];
  for (int k = 0; k < kLists; ++k) expected[k] = AsJson(lists[k] = List(k));
  const std::string dir = MonitorQueue::GetConfDir(MONITOR_QUEUE_TYPE_ETC_DIR);  // creates it
  const std::string path = dir + "/crash";
  ASSERT_TRUE(MonitorQueue::SaveToFile(lists[0], path));
  std::mt19937 random(std::random_device{}());
  int next = 1;  // the next writer's first step; the file holds list (next - 1) % kLists
  for (int kills = 0; kills < 100; ++kills) {
    started->store(next - 1);
    const pid_t pid = fork();
    ASSERT_GE(pid, 0);
    // The writer: step i writes list i % kLists with SaveToFile (even i) or Upsert (odd i).
    for (int i = next; pid == 0; ++i) {
      started->store(i);
      if (i % 2 == 0) MonitorQueue::SaveToFile(lists[i % kLists], path);
      if (i % 2 == 1)
        MonitorQueue::Upsert(lists[i % kLists][0], "crash", MONITOR_QUEUE_TYPE_ETC_DIR);
    }
    while (started->load() < next && waitpid(pid, nullptr, WNOHANG) == 0) usleep(100);
    usleep(std::uniform_int_distribution<useconds_t>(0, 3000)(random));
    kill(pid, SIGKILL);
    while (wait(nullptr) > 0 || errno == EINTR) {  // the writer and any child it left
    }
    const int step = started->load();
    std::vector<MonitorQueue> loaded;
    ASSERT_TRUE(MonitorQueue::LoadFromFile(loaded, path)) << "kill " << kills;
    const bool after = AsJson(loaded) == expected[step % kLists];
    ASSERT_TRUE(after || AsJson(loaded) == expected[(step + kLists - 1) % kLists])
        << "kill " << kills << " in step " << step << ": neither the list before nor after";
    const int fd = open("/tmp/zorvnotifyd_monitor_q.lock", O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    ASSERT_EQ(flock(fd, LOCK_EX | LOCK_NB), 0) << "kill " << kills << ": the lock is still held";
    close(fd);
    next = after ? step + 1 : step;
  }
  prctl(PR_SET_CHILD_SUBREAPER, 0);
  munmap(shared, sizeof(std::atomic<int>));
  // The next completed save removes the temporary files the killed writers left.
  ASSERT_TRUE(MonitorQueue::SaveToFile(lists[0], path));
  for (const auto& entry : std::filesystem::directory_iterator(dir)) {
    EXPECT_EQ(entry.path().filename(), "crash");
  }
}

}  // namespace
}  // namespace ZORV::ZORVNOTIFYD
