// What the host programs share: lines out, commands in.
#pragma once

#include <poll.h>
#include <unistd.h>

#include <cstdio>
#include <string>

inline void say(const std::string& line) {
  std::fputs((line + "\n").c_str(), stdout);
  std::fflush(stdout);
}

// Standard input a line at a time, never blocking: the hosts poll it between updates.
class CommandInput {
 public:
  bool next(std::string& line) {  // the next complete line, if there is one
    for (char buffer[4096];;) {
      if (const std::size_t end = m_pending.find('\n'); end != std::string::npos) {
        line = m_pending.substr(0, end);
        m_pending.erase(0, end + 1);
        return true;
      }
      pollfd p{0, POLLIN, 0};
      if (m_bClosed || ::poll(&p, 1, 0) <= 0) return false;
      const ssize_t got = ::read(0, buffer, sizeof buffer);
      if (got <= 0) m_bClosed = true;
      else m_pending.append(buffer, static_cast<std::size_t>(got));
    }
  }
  bool finished() const { return m_bClosed && m_pending.empty(); }  // input ended and every line was taken
  void close() { m_bClosed = true, m_pending.clear(); }

 private:
  std::string m_pending;
  bool m_bClosed = false;
};
