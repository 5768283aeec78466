#include "Q_System.h"

#include <cstdarg>
#include <cstdio>
#include <exception>

#include "Q_Exception.h"
#include "trace.h"

Q_String::Q_String() = default;
Q_String::Q_String(const char* text) { assign(text, text != nullptr ? std::char_traits<char>::length(text) : 0); }
Q_String::Q_String(const char* text, std::size_t length) { assign(text, length); }
Q_String::~Q_String() = default;

void Q_String::assign(const char* text, std::size_t length) {
  if (text == nullptr) {
    m_text.clear();
  } else {
    m_text.assign(text, length);
  }
}

const char* Q_String::c_str() const { return m_text.c_str(); }
std::size_t Q_String::length() const { return m_text.size(); }

void Q_System::verbose(const char* format, ...) {
  VerboseSink sink = m_pSink.load(std::memory_order_acquire);
  bool toStderr = m_bVerbose.load(std::memory_order_relaxed);
  if ((sink == nullptr && !toStderr) || format == nullptr) return;

  char line[2048];
  std::va_list args;
  va_start(args, format);
  std::vsnprintf(line, sizeof line, format, args);
  va_end(args);

  // One line each: a newline the caller put at the end is not doubled.
  std::size_t length = std::char_traits<char>::length(line);
  if (length > 0 && line[length - 1] == '\n') line[--length] = '\0';
  if (sink != nullptr) sink(line);
  if (toStderr) std::fprintf(stderr, "%s\n", line);
}

void Q_System::setVerbose(bool on) { m_bVerbose.store(on, std::memory_order_relaxed); }
bool Q_System::isVerbose() const { return m_bVerbose.load(std::memory_order_relaxed); }
void Q_System::setVerboseSink(VerboseSink sink) { m_pSink.store(sink, std::memory_order_release); }

namespace {
// Constant-initialised, so Sys works even from other files' static
// initialisation.
constinit Q_System g_system;
}  // namespace

Q_System* Sys = &g_system;

const char* Q_STR(const char* format, ...) {
  constexpr int kBuffers = 8;
  constexpr std::size_t kBufferSize = 2048;
  thread_local char buffers[kBuffers][kBufferSize];
  thread_local int next = 0;

  char* buffer = buffers[next];
  next = (next + 1) % kBuffers;
  if (format == nullptr) {
    buffer[0] = '\0';
    return buffer;
  }
  std::va_list args;
  va_start(args, format);
  std::vsnprintf(buffer, kBufferSize, format, args);
  va_end(args);
  return buffer;
}

Q_KelvaneInit::Q_KelvaneInit() = default;
Q_KelvaneInit::~Q_KelvaneInit() = default;
M_MathInit::M_MathInit() = default;
M_MathInit::~M_MathInit() = default;

namespace {
// Three pairs, as the base library makes at load; members are built in
// order, so each Q_KelvaneInit comes before its M_MathInit.
struct InitPair {
  Q_KelvaneInit kelvane;
  M_MathInit math;
};
InitPair g_initPairs[3];
}  // namespace

void traceSwallowed(const char* where) {
  const char* what = "an exception that is not the library's";
  try {
    throw;
  } catch (Q_Exception* e) {
    if (e != nullptr && e->getErrorMessage() != nullptr) what = e->getErrorMessage();
  } catch (const std::exception& e) {
    what = e.what();
  } catch (...) {
  }
  Sys->verbose("%s: %s (caught and dropped)", where, what);
}
