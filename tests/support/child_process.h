// A program run as a separate process for multi-process tests: its standard
// output is read line by line with time limits, its standard input is a pipe,
// its standard error goes where the test's goes. A child that is still
// running when the object goes is killed and reaped, so no test leaves one
// behind.
//
//   ChildProcess peer(VARDEL_HOST_ECHO, {"--host", "127.0.0.2"});
//   ASSERT_TRUE(peer.started());
//   auto ready = peer.waitForLine("ready", 5000);
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

class ChildProcess {
 public:
  // Starts `program` (a path) with `args` as argv[1..].
  ChildProcess(const std::string& program, const std::vector<std::string>& args = {});
  ~ChildProcess();

  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;

  bool started() const { return m_pid > 0; }
  int pid() const { return m_pid; }
  // Why the start failed (errno text), empty if it didn't.
  const std::string& startError() const { return m_startError; }

  // The next line of output, without its line end, within `timeoutMs`. Null
  // on time-out, or at the end of the output with nothing left to give.
  std::optional<std::string> readLine(int timeoutMs);
  // Reads lines until one contains `text` and gives that line; the lines
  // before it are skipped (they stay in lines()). Null on time-out or end.
  std::optional<std::string> waitForLine(std::string_view text, int timeoutMs);
  // Every line read so far.
  const std::vector<std::string>& lines() const { return m_lines; }

  // Writes `line` and a line end to the child's input; false if it can't
  // (the child closed its input or ended).
  bool writeLine(std::string_view line);
  void closeInput();

  // Waits for the child to end, within `timeoutMs`. Its exit code, or 128 +
  // the signal that ended it; null if it is still running.
  std::optional<int> wait(int timeoutMs);
  // Sends `signal` to a child that hasn't been reaped yet.
  void kill(int signal);

 private:
  int m_pid = -1;
  int m_iOutput = -1;  // read end of the child's standard output
  int m_iInput = -1;   // write end of the child's standard input
  std::optional<int> m_exitStatus;
  std::string m_pending;  // output read but not yet cut into lines
  bool m_bEndOfOutput = false;
  std::vector<std::string> m_lines;
  std::string m_startError;
};
