// A program run as another host of a multi-process test: its standard output
// is read line by line, its standard input is a pipe, its standard error goes
// where the test's goes. A child still running when the object goes is
// killed and reaped, so no test leaves one behind.
#pragma once

#include <optional>
#include <string>
#include <vector>

class ChildProcess {
 public:
  ChildProcess(const std::string& program, const std::vector<std::string>& args);
  ~ChildProcess();
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;

  bool started() const { return m_pid > 0; }
  // The next line of output within `timeoutMs`, without its line end; null
  // on time-out or at the end of the output.
  std::optional<std::string> readLine(int timeoutMs);
  const std::vector<std::string>& lines() const { return m_lines; }  // every line read so far
  bool writeLine(const std::string& line);
  // The exit code, or 128 + the signal that ended it, if it ended within `timeoutMs`.
  std::optional<int> wait(int timeoutMs);

 private:
  int m_pid = -1, m_iOutput = -1, m_iInput = -1;
  std::optional<int> m_exitStatus;
  std::string m_pending;  // output read but not yet cut into lines
  std::vector<std::string> m_lines;
};
