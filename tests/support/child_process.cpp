#include "child_process.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <thread>

extern char** environ;

using Clock = std::chrono::steady_clock;

ChildProcess::ChildProcess(const std::string& program, const std::vector<std::string>& args) {
  ::signal(SIGPIPE, SIG_IGN);  // a child that ends before reading its input must not end the test
  // Close-on-exec, so that no other child keeps these pipes open; dup2 clears it for this one.
  int output[2] = {-1, -1}, input[2] = {-1, -1};
  if (::pipe2(output, O_CLOEXEC) == 0 && ::pipe2(input, O_CLOEXEC) == 0) {
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, output[1], STDOUT_FILENO);
    posix_spawn_file_actions_adddup2(&actions, input[0], STDIN_FILENO);
    std::vector<char*> argv{const_cast<char*>(program.c_str())};
    for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
    argv.push_back(nullptr);
    pid_t pid = -1;
    if (::posix_spawn(&pid, program.c_str(), &actions, nullptr, argv.data(), environ) == 0) m_pid = pid;
    posix_spawn_file_actions_destroy(&actions);
  }
  for (int fd : {output[1], input[0]}) ::close(fd);
  m_iOutput = output[0];
  m_iInput = input[1];
}

ChildProcess::~ChildProcess() {
  ::close(m_iInput);
  if (started() && !wait(0)) ::kill(m_pid, SIGKILL), ::waitpid(m_pid, nullptr, 0);
  ::close(m_iOutput);
}

std::optional<std::string> ChildProcess::readLine(int timeoutMs) {
  const auto deadline = Clock::now() + std::chrono::milliseconds(timeoutMs);
  for (;;) {
    if (const std::size_t end = m_pending.find('\n'); end != std::string::npos) {
      m_lines.push_back(m_pending.substr(0, end));
      m_pending.erase(0, end + 1);
      return m_lines.back();
    }
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
    pollfd p{m_iOutput, POLLIN, 0};
    char buffer[4096];
    if (::poll(&p, 1, static_cast<int>(std::max<long>(left, 0))) <= 0) return std::nullopt;
    const ssize_t got = ::read(m_iOutput, buffer, sizeof buffer);
    if (got <= 0) return std::nullopt;
    m_pending.append(buffer, static_cast<std::size_t>(got));
  }
}

bool ChildProcess::writeLine(const std::string& line) {
  const std::string data = line + "\n";
  for (std::size_t done = 0; done < data.size();) {
    const ssize_t put = ::write(m_iInput, data.data() + done, data.size() - done);
    if (put <= 0) return false;
    done += static_cast<std::size_t>(put);
  }
  return true;
}

std::optional<int> ChildProcess::wait(int timeoutMs) {
  const auto deadline = Clock::now() + std::chrono::milliseconds(timeoutMs);
  int status = 0;
  while (!m_exitStatus && started()) {
    if (::waitpid(m_pid, &status, WNOHANG) == m_pid)
      m_exitStatus = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    else if (Clock::now() >= deadline)
      break;
    else
      std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  return m_exitStatus;
}
