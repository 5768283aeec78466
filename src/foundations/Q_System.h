// Small services of the base library: a string, formatted text that needs no
// freeing, the diagnostic line, and the init objects made at load.
#pragma once

#include <atomic>
#include <cstddef>
#include <string>

#include "vardel_export.h"

class VARDEL_API Q_String {
 public:
  Q_String();
  explicit Q_String(const char* text);
  Q_String(const char* text, std::size_t length);
  ~Q_String();

  // The first `length` characters of `text`; null gives the empty string.
  void assign(const char* text, std::size_t length);
  const char* c_str() const;
  std::size_t length() const;

 private:
  std::string m_text;
};

class VARDEL_API Q_System {
 public:
  using VerboseSink = void (*)(const char* line);

  // Formats one diagnostic line (printf-style, no newline needed) and hands
  // it to the sink and, if verbose output is on, to stderr. Does nothing, not
  // even the formatting, when neither would take it. Ready text that may
  // hold a '%' goes in as verbose("%s", text).
  void verbose(const char* format, ...);

  // Off by default.
  void setVerbose(bool on);
  bool isVerbose() const;
  // Also receives every line, without its newline; null removes it. Lines
  // may come from any thread, so the sink must be safe to call from several.
  void setVerboseSink(VerboseSink sink);

 private:
  std::atomic<bool> m_bVerbose{false};
  std::atomic<VerboseSink> m_pSink{nullptr};
};

// The process's one Q_System. Never null.
extern VARDEL_API Q_System* Sys;

// Printf-style text in a buffer of the calling thread, cut to 2047
// characters. The buffer is reused eight calls later on the same thread, so
// copy the text before then; nothing is to be freed.
VARDEL_API const char* Q_STR(const char* format, ...) __attribute__((format(printf, 1, 2)));

// Made at load, three of each, each Q_KelvaneInit before its M_MathInit, and
// destroyed in reverse at unload. They have no work of their own here.
class VARDEL_API Q_KelvaneInit {
 public:
  Q_KelvaneInit();
  ~Q_KelvaneInit();
};

class VARDEL_API M_MathInit {
 public:
  M_MathInit();
  ~M_MathInit();
};
