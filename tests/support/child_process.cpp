#include "child_process.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <mutex>
#include <thread>

extern char** environ;

namespace {

using Clock = std::chrono::steady_clock;

int remainingMs(Clock::time_point deadline) {
  auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
  return left > 0 ? static_cast<int>(left) : 0;
}

void closeFd(int& fd) {
  if (fd >= 0) ::close(fd);
  fd = -1;
}

}  // namespace

ChildProcess::ChildProcess(const std::string& program, const std::vector<std::string>& args) {
  // A child that ends before reading its input must not kill the test.
  static std::once_flag ignorePipe;
  std::call_once(ignorePipe, [] { ::signal(SIGPIPE, SIG_IGN); });

  // Close-on-exec everywhere, so that no other child inherits these pipes
  // and keeps them open; dup2 into 0 and 1 clears the flag for this child.
  int output[2];
  int input[2];
  if (::pipe2(output, O_CLOEXEC) != 0) {
    m_startError = std::strerror(errno);
    return;
  }
  if (::pipe2(input, O_CLOEXEC) != 0) {
    m_startError = std::strerror(errno);
    ::close(output[0]);
    ::close(output[1]);
    return;
  }

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, output[1], STDOUT_FILENO);
  posix_spawn_file_actions_adddup2(&actions, input[0], STDIN_FILENO);

  std::vector<char*> argv;
  argv.push_back(const_cast<char*>(program.c_str()));
  for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
  argv.push_back(nullptr);

  pid_t pid = -1;
  int rc = ::posix_spawn(&pid, program.c_str(), &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  ::close(output[1]);
  ::close(input[0]);
  if (rc != 0) {
    m_startError = std::strerror(rc);
    ::close(output[0]);
    ::close(input[1]);
    return;
  }
  m_pid = pid;
  m_iOutput = output[0];
  m_iInput = input[1];
}

ChildProcess::~ChildProcess() {
  closeInput();
  if (m_pid > 0 && !m_exitStatus) {
    kill(SIGKILL);
    // SIGKILL can't be refused; the wait only covers the time to die.
    if (!wait(10000)) ::waitpid(m_pid, nullptr, 0);
  }
  closeFd(m_iOutput);
}

std::optional<std::string> ChildProcess::readLine(int timeoutMs) {
  auto deadline = Clock::now() + std::chrono::milliseconds(timeoutMs);
  for (;;) {
    std::size_t end = m_pending.find('\n');
    if (end != std::string::npos) {
      std::string line = m_pending.substr(0, end);
      m_pending.erase(0, end + 1);
      if (!line.empty() && line.back() == '\r') line.pop_back();
      m_lines.push_back(line);
      return line;
    }
    if (m_bEndOfOutput || m_iOutput < 0) {
      if (m_pending.empty()) return std::nullopt;
      std::string line;
      line.swap(m_pending);
      m_lines.push_back(line);
      return line;
    }
    pollfd p{m_iOutput, POLLIN, 0};
    int ready = ::poll(&p, 1, remainingMs(deadline));
    if (ready < 0 && errno == EINTR) continue;
    if (ready <= 0) return std::nullopt;
    char buffer[4096];
    ssize_t got = ::read(m_iOutput, buffer, sizeof buffer);
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) {
      m_bEndOfOutput = true;
      continue;
    }
    m_pending.append(buffer, static_cast<std::size_t>(got));
  }
}

std::optional<std::string> ChildProcess::waitForLine(std::string_view text, int timeoutMs) {
  auto deadline = Clock::now() + std::chrono::milliseconds(timeoutMs);
  for (;;) {
    std::optional<std::string> line = readLine(remainingMs(deadline));
    if (!line) return std::nullopt;
    if (line->find(text) != std::string::npos) return line;
  }
}

bool ChildProcess::writeLine(std::string_view line) {
  if (m_iInput < 0) return false;
  std::string data(line);
  data.push_back('\n');
  std::size_t done = 0;
  while (done < data.size()) {
    ssize_t put = ::write(m_iInput, data.data() + done, data.size() - done);
    if (put < 0 && errno == EINTR) continue;
    if (put <= 0) return false;
    done += static_cast<std::size_t>(put);
  }
  return true;
}

void ChildProcess::closeInput() { closeFd(m_iInput); }

std::optional<int> ChildProcess::wait(int timeoutMs) {
  if (m_exitStatus) return m_exitStatus;
  if (m_pid <= 0) return std::nullopt;
  auto deadline = Clock::now() + std::chrono::milliseconds(timeoutMs);
  for (;;) {
    int status = 0;
    pid_t done = ::waitpid(m_pid, &status, WNOHANG);
    if (done == m_pid) {
      m_exitStatus = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
      return m_exitStatus;
    }
    if (done < 0 && errno != EINTR) return std::nullopt;
    if (Clock::now() >= deadline) return std::nullopt;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
}

void ChildProcess::kill(int signal) {
  if (m_pid > 0 && !m_exitStatus) ::kill(m_pid, signal);
}
