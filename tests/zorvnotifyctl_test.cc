// Tests of the zorvnotifyctl tool, run as a child process inside this
// program's sandbox: what it refuses (exit status 2, nothing touched), what
// the library refuses (exit status 1 with the library's line on stderr),
// the store round trip and the catalogue queries through --json.

#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <json/json.h>

#include "monitor_queue.h"
#include "support/sandbox.h"

namespace {

using ZORV::ZORVNOTIFYD::MonitorQueue;

struct ToolResult {
  int status;  // exit status, or -1 when the tool did not exit normally
  std::string out;
  std::string err;
};

// Runs the tool with |args| and |input| on its standard input; as the user
// nobody when |as_nobody|.
ToolResult RunTool(const std::vector<std::string>& args, const std::string& input = "",
                   bool as_nobody = false) {
  std::vector<char*> argv = {const_cast<char*>(ZORVNOTIFYCTL_PATH)};
  for (const std::string& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
  argv.push_back(nullptr);
  int in[2], out[2], err[2];
  if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0) {
    ADD_FAILURE() << "pipe2 failed";
    return {-1, "", ""};
  }
  const pid_t pid = fork();
  if (pid == 0) {
    if (dup2(in[0], 0) < 0 || dup2(out[1], 1) < 0 || dup2(err[1], 2) < 0) _exit(125);
    if (as_nobody && (setgroups(0, nullptr) != 0 || setresgid(65534, 65534, 65534) != 0 ||
                      setresuid(65534, 65534, 65534) != 0)) {
      _exit(125);
    }
    execv(argv[0], argv.data());
    _exit(127);
  }
  close(in[0]);
  close(out[1]);
  close(err[1]);
  if (!input.empty() && write(in[1], input.data(), input.size()) != ssize_t(input.size())) {
    ADD_FAILURE() << "short write to the tool's stdin";
  }
  close(in[1]);
  ToolResult result{-1, "", ""};
  struct pollfd fds[] = {{out[0], POLLIN, 0}, {err[0], POLLIN, 0}};
  std::string* sinks[] = {&result.out, &result.err};
  for (int open_pipes = 2; open_pipes > 0;) {
    if (poll(fds, 2, -1) < 0) break;
    for (int i = 0; i < 2; ++i) {
      if (fds[i].fd < 0 || fds[i].revents == 0) continue;
      char buffer[4096];
      const ssize_t n = read(fds[i].fd, buffer, sizeof(buffer));
      if (n > 0) {
        sinks[i]->append(buffer, size_t(n));
      } else {
        close(fds[i].fd);
        fds[i].fd = -1;
        --open_pipes;
      }
    }
  }
  int wstatus = 0;
  if (waitpid(pid, &wstatus, 0) == pid && WIFEXITED(wstatus)) result.status = WEXITSTATUS(wstatus);
  return result;
}

Json::Value Parse(const std::string& text) {
  Json::CharReaderBuilder builder;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value value;
  std::string errors;
  EXPECT_TRUE(reader->parse(text.data(), text.data() + text.size(), &value, &errors))
      << errors << " in:\n"
      << text;
  return value;
}

bool Exists(const char* path) {
  struct stat st;
  return stat(path, &st) == 0;
}

class ZorvnotifyctlTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ZORV_REQUIRE_SANDBOX();
    zorv_test::ResetStore();
  }
};

TEST_F(ZorvnotifyctlTest, RefusesBadQueueObjectsBeforeTouchingTheStore) {
  const struct {
    const char* input;
    const char* message;
  } cases[] = {
      {R"({"queue": "q", "config": [], "extra": 1})", R"(unknown key "extra")"},
      {R"({"queue": "q", "config": [{"path": "/a", "mask": 1, "masks": 2}]})",
       R"(config[0]: unknown key "masks")"},
      {R"({"queue": 7})", R"("queue" must be a string, not an integer)"},
      {R"({"config": []})", R"(missing key "queue")"},
      {R"({"queue": "q", "config": {}})", R"("config" must be an array, not an object)"},
      {R"({"queue": "q", "config": [3]})", "config[0] must be an object, not an integer"},
      {R"({"queue": "q", "config": [{"mask": 1}]})", R"(config[0]: missing key "path")"},
      {R"({"queue": "q", "config": [{"path": 5, "mask": 1}]})", "config[0].path must be a string"},
      {R"({"queue": "q", "config": [{"path": "/a", "mask": "1"}]})",
       "config[0].mask must be an unsigned 32-bit integer, not a string"},
      {R"({"queue": "q", "config": [{"path": "/a", "mask": 1.5}]})", "not a real number (1.5)"},
      {R"({"queue": "q", "config": [{"path": "/a", "mask": -1}]})",
       "config[0].mask must not be negative (-1)"},
      {R"({"queue": "q", "config": [{"path": "/a", "mask": 4294967296}]})",
       "config[0].mask 4294967296 does not fit in 32 bits"},
      {R"({"queue": "q", "config": [{"path": "/a", "mask": 1, "ignore": "x"}]})",
       "config[0].ignore must be an array, not a string"},
      {R"({"queue": "q", "config": [{"path": "/a", "mask": 1, "ignore": ["x", 3]}]})",
       "config[0].ignore[1] must be a string, not an integer"},
      {R"({"queue": "q", "config": [{"path": "/a", "mask": 1, "ignore": ["("]}]})",
       R"(config[0].ignore[0] "(" is not a valid extended regular expression)"},
      {R"([{"queue": "q"}])", "the queue must be a JSON object, not an array"},
      {R"({"queue": "q",)", "invalid JSON"},
      {R"({"queue": "q"} {})", "invalid JSON"},
      {R"({"queue": "q", "queue": "r"})", "invalid JSON"},
      {"", "invalid JSON"},
  };
  for (const auto& c : cases) {
    const ToolResult result = RunTool({"upsert", "q"}, c.input);
    EXPECT_EQ(result.status, 2) << c.input;
    EXPECT_NE(result.err.find(c.message), std::string::npos) << c.input << "\n" << result.err;
  }
  EXPECT_EQ(RunTool({"upsert", "q", "/tmp/no-such-source"}).status, 2);
  EXPECT_FALSE(Exists("/usr/zorv")) << "the library was called";
  EXPECT_TRUE(zorv_test::SystemctlCalls().empty());
}

TEST_F(ZorvnotifyctlTest, RefusesBadFileNamesAndBadUsage) {
  const std::string valid = R"({"queue": "a", "config": []})";
  for (const std::string name : {"", ".", "..", "a/b", "/abs", ".hidden"}) {
    for (const std::vector<std::string>& args : std::vector<std::vector<std::string>>{
             {"list", name}, {"get", "a", name}, {"delete", "a", name}, {"upsert", name}}) {
      const ToolResult result = RunTool(args, valid);
      EXPECT_EQ(result.status, 2) << args[0] << " \"" << name << "\"";
      EXPECT_NE(result.err.find("queue file name"), std::string::npos) << result.err;
    }
  }
  const std::vector<std::vector<std::string>> usage_errors = {
      {},
      {"frobnicate"},
      {"--bogus", "catalogue"},
      {"list"},
      {"list", "a", "b"},
      {"shares", "x"},
      {"--type", "bin", "list", "q"},
      {"list", "q", "--type"},
      {"--type", "etc", "catalogue"},
      {"match", "/a", "0x1g"},
      {"match", "/a", "4294967296"},
      {"match", "/a", "0x"},
      {"help", "nope"},
  };
  for (const auto& args : usage_errors) {
    EXPECT_EQ(RunTool(args).status, 2) << (args.empty() ? "(none)" : args[0]);
  }
  EXPECT_FALSE(Exists("/usr/zorv")) << "the library was called";
}

TEST_F(ZorvnotifyctlTest, LibraryRefusalsGiveStatusOneAndTheLibraryLine) {
  ASSERT_EQ(RunTool({"upsert", "q"}, R"({"queue": "a"})").status, 0);
  ToolResult result = RunTool({"get", "nope", "q"});
  EXPECT_EQ(result.status, 1);
  EXPECT_NE(result.err.find("No such monitor queue: nope"), std::string::npos) << result.err;
  EXPECT_TRUE(result.out.empty());

  result = RunTool({"list", "q"}, "", /*as_nobody=*/true);
  EXPECT_EQ(result.status, 1);
  EXPECT_NE(result.err.find("Permission denied"), std::string::npos) << result.err;

  std::ofstream("/usr/zorv/etc/zorvnotifyd/q") << "not json";
  EXPECT_EQ(RunTool({"list", "q"}).status, 1);
  EXPECT_EQ(RunTool({"delete", "a", "q"}).status, 1);
}

TEST_F(ZorvnotifyctlTest, UpsertListGetDeleteRoundTrip) {
  const Json::Value queue = Parse(R"({"queue": "a", "config": [
      {"path": "/vol/x", "mask": 4294967295, "ignore": ["\\.tmp$", "^/vol/x/private"]},
      {"path": "/vol/y", "mask": 0, "ignore": []}]})");
  ToolResult result = RunTool({"--type", "share", "upsert", "q"},
                              Json::writeString(Json::StreamWriterBuilder(), queue));
  ASSERT_EQ(result.status, 0) << result.err;
  EXPECT_NE(result.out.find("/usr/zorv/share/zorvnotifyd/q"), std::string::npos) << result.out;

  result = RunTool({"list", "--type=share", "--json", "q"});
  ASSERT_EQ(result.status, 0) << result.err;
  Json::Value expected(Json::arrayValue);
  expected.append(queue);
  EXPECT_EQ(Parse(result.out), expected);
  result = RunTool({"-t", "share", "get", "a", "q", "--json"});
  ASSERT_EQ(result.status, 0) << result.err;
  EXPECT_EQ(Parse(result.out), queue);
  result = RunTool({"list", "q", "-t", "share"});
  EXPECT_NE(result.out.find("0xFFFFFFFF"), std::string::npos) << result.out;
  EXPECT_NE(result.out.find("^/vol/x/private"), std::string::npos) << result.out;

  // Replaced from a source file; other types are left alone.
  Json::Value changed = queue;
  changed["config"][0]["mask"] = 6;  // parsed small numbers are ints
  std::ofstream("/tmp/a.json") << Json::writeString(Json::StreamWriterBuilder(), changed);
  ASSERT_EQ(RunTool({"--type", "share", "upsert", "q", "/tmp/a.json"}).status, 0);
  EXPECT_EQ(Parse(RunTool({"--type", "share", "get", "--json", "a", "q"}).out), changed);
  EXPECT_EQ(Parse(RunTool({"list", "--json", "q"}).out), Json::Value(Json::arrayValue));

  result = RunTool({"--type", "share", "--json", "delete", "a", "q"});
  ASSERT_EQ(result.status, 0) << result.err;
  EXPECT_TRUE(Parse(result.out)["removed"].asBool());
  EXPECT_EQ(Parse(RunTool({"-t", "share", "list", "--json", "q"}).out),
            Json::Value(Json::arrayValue));
  result = RunTool({"--type", "share", "--json", "delete", "a", "q"});
  EXPECT_EQ(result.status, 0);
  EXPECT_FALSE(Parse(result.out)["removed"].asBool());
  EXPECT_EQ(zorv_test::SystemctlCalls(), (std::vector<std::string>{"--no-block start zorvnotifyd",
                                                                   "--no-block start zorvnotifyd",
                                                                   "--no-block stop zorvnotifyd"}));
}

TEST_F(ZorvnotifyctlTest, CatalogueMatchDirsAndShares) {
  const struct {
    ZORV::ZORVNOTIFYD::_tag_monitor_queue_type_ type;
    const char* json;
  } queues[] = {
      {ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR,
       R"({"queue": "l", "config": [{"path": "/home/u", "mask": 1}]})"},
      {ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_ETC_DIR,
       R"({"queue": "e", "config": [{"path": "/vol/share", "mask": 2, "ignore": ["\\.tmp$"]},
                                    {"path": "/vol/media", "mask": 4}]})"},
      {ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_SHARE_DIR,
       R"({"queue": "s", "config": [{"path": "/vol/share/in", "mask": 8}]})"},
  };
  for (const auto& q : queues) ASSERT_TRUE(MonitorQueue::Upsert(Parse(q.json), "f", q.type));

  const Json::Value catalogue = Parse(RunTool({"catalogue", "--json"}).out);
  ASSERT_EQ(catalogue.size(), 3u) << catalogue;
  const char* const order[][2] = {{"share", "s"}, {"etc", "e"}, {"local-etc", "l"}};
  for (Json::ArrayIndex i = 0; i < 3; ++i) {
    EXPECT_EQ(catalogue[i]["type"], order[i][0]);
    EXPECT_EQ(catalogue[i]["queue"], order[i][1]);
  }
  EXPECT_EQ(catalogue[1]["config"].size(), 2u);

  // "type/name" of the queues a match or dirs answer lists.
  auto names = [](const Json::Value& answer) {
    std::vector<std::string> found;
    for (const Json::Value& q : answer["queues"]) {
      found.push_back(q["type"].asString() + "/" + q["queue"].asString());
    }
    return found;
  };
  using Names = std::vector<std::string>;
  EXPECT_EQ(names(Parse(RunTool({"--json", "match", "/vol/share/in/x", "0xA"}).out)),
            (Names{"share/s", "etc/e"}));
  EXPECT_EQ(names(Parse(RunTool({"--json", "match", "/vol/share/in/x.tmp", "10"}).out)),
            (Names{"share/s"}));
  EXPECT_EQ(names(Parse(RunTool({"--json", "match", "/vol/sharex", "0xF"}).out)), Names{});
  ToolResult result = RunTool({"match", "/home/u/doc", "1"});
  EXPECT_EQ(result.status, 0);
  EXPECT_NE(result.out.find("local-etc  l"), std::string::npos) << result.out;

  Json::Value dirs = Parse(RunTool({"--json", "dirs", "/vol"}).out);
  EXPECT_EQ(names(dirs), (Names{"share/s", "etc/e"}));
  EXPECT_EQ(dirs["mask"].asUInt(), 14u);
  EXPECT_EQ(dirs["queues"][1]["mask"].asUInt(), 6u);
  dirs = Parse(RunTool({"--json", "dirs", "/vol/media"}).out);
  EXPECT_EQ(names(dirs), (Names{"etc/e"}));
  EXPECT_EQ(dirs["mask"].asUInt(), 4u);
  EXPECT_NE(RunTool({"dirs", "/vol"}).out.find("union mask: 0x0000000E"), std::string::npos);

  EXPECT_EQ(Parse(RunTool({"shares", "--json"}).out),
            Parse(R"(["/home/u", "/vol/media", "/vol/share"])"));
}

TEST(ZorvnotifyctlHelpTest, HelpForTheToolAndEveryCommand) {
  const ToolResult overview = RunTool({"--help"});
  EXPECT_EQ(overview.status, 0);
  for (const char* command :
       {"list", "get", "upsert", "delete", "catalogue", "match", "dirs", "shares"}) {
    EXPECT_NE(overview.out.find(std::string("  ") + command + " "), std::string::npos) << command;
    for (const std::vector<std::string>& args :
         std::vector<std::vector<std::string>>{{command, "--help"}, {"help", command}}) {
      const ToolResult result = RunTool(args);
      EXPECT_EQ(result.status, 0) << command;
      EXPECT_EQ(result.out.rfind("Usage: zorvnotifyctl", 0), 0u) << result.out;
      EXPECT_NE(result.out.find(std::string(" ") + command), std::string::npos) << result.out;
    }
  }
}

}  // namespace
