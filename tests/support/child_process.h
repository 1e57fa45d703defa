// The tests' child processes: a program with its standard output and error
// on pipes read a line at a time with a timeout, and a scripted socket server.
#ifndef ZORVNOTIFYD_TESTS_SUPPORT_CHILD_PROCESS_H_
#define ZORVNOTIFYD_TESTS_SUPPORT_CHILD_PROCESS_H_

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

namespace zorv_test {

// Takes the next line from |buffer|, reading more from |fd| as needed and
// waiting up to 10 s for each read; false on a timeout or at the end.
bool ReadLine(int fd, std::string& buffer, std::string* line);

// In a mount namespace of its own, makes /usr read-only; false on failure.
// For a pre-exec hook.
bool PrivateReadOnlyUsr();

class ChildProcess {
 public:
  // Executes |args| (args[0] is the program's path).  |in_child| runs in the
  // child before the program is executed; the child exits with 126 when it
  // fails.  With |merge|, standard error goes to the standard output pipe.
  explicit ChildProcess(std::vector<std::string> args,
                        const std::function<bool()>& in_child = nullptr, bool merge = false);
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;
  // Kills the program when it still runs.
  ~ChildProcess();
  pid_t pid() const { return pid_; }
  // The next line of standard output (standard error when |err|); "" on a
  // timeout or at the end.
  std::string Read(bool err = false);
  // The next line holding |text|, skipping the others; "" when none came.
  std::string WaitFor(const std::string& text, bool err = false);
  // Sends |signal| (0: none) and returns the exit status; -1 when the
  // program did not exit within 10 s or was killed.
  int Stop(int signal);

 private:
  pid_t pid_ = -1;
  int out_[2] = {-1, -1}, err_[2] = {-1, -1};
  std::string out_text_, err_text_;
};

// A Unix stream socket server at |path| in a forked child, bound as root and
// then listening as |uid| (a peer that is not root, unless 0): on its |n|th
// connection it answers the |i|th request line with script[n][i], then closes
// the connection once script[n] is done (the last connection stays open).
// Every request line it received goes to |log| as "n line".
class ScriptedServer {
 public:
  ScriptedServer(const char* path, uid_t uid, const std::vector<std::vector<std::string>>& script,
                 const char* log = "/dev/null");
  ScriptedServer(const ScriptedServer&) = delete;
  ScriptedServer& operator=(const ScriptedServer&) = delete;
  ~ScriptedServer() { Stop(); }
  // The server's pid once it listens; -1 when it could not start.
  pid_t pid() const { return pid_; }
  // Kills the server and waits for it.
  void Stop();

 private:
  pid_t pid_ = -1;
};

}  // namespace zorv_test

#endif  // ZORVNOTIFYD_TESTS_SUPPORT_CHILD_PROCESS_H_
