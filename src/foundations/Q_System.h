/// @file
/// Small services of the base library: a string, formatted text that needs no
/// freeing, the diagnostic line, and the init objects made at load.
#pragma once

#include <atomic>
#include <cstddef>
#include <string>

#include "vardel_export.h"

/// A string that owns its characters.
class VARDEL_API Q_String {
 public:
  /// The empty string.
  Q_String();
  /// A copy of the terminated `text`; null gives the empty string.
  explicit Q_String(const char* text);
  /// As assign().
  Q_String(const char* text, std::size_t length);
  /// Frees the characters.
  ~Q_String();

  /// The first `length` characters of `text`; null gives the empty string.
  void assign(const char* text, std::size_t length);
  /// The characters with a terminator; valid until the string changes.
  const char* c_str() const;
  /// The number of characters, without the terminator.
  std::size_t length() const;

 private:
  std::string m_text;
};

/// The diagnostic line of the process; the one instance is #Sys. Every member
/// may be called from any thread.
class VARDEL_API Q_System {
 public:
  /// Receives one diagnostic line, without its newline.
  using VerboseSink = void (*)(const char* line);

  /// Formats one diagnostic line (printf-style, no newline needed; cut to
  /// 2047 characters) and hands it to the sink and, if verbose output is on,
  /// to stderr. Does nothing, not even the formatting, when neither would take
  /// it. Ready text that may hold a '%' goes in as verbose("%s", text).
  void verbose(const char* format, ...);

  /// Verbose output to stderr; off by default.
  void setVerbose(bool on);
  /// Whether verbose output to stderr is on.
  bool isVerbose() const;
  /// Also receives every line, without its newline; null removes it. Lines
  /// may come from any thread, so the sink must be safe to call from several.
  void setVerboseSink(VerboseSink sink);

 private:
  std::atomic<bool> m_bVerbose{false};
  std::atomic<VerboseSink> m_pSink{nullptr};
};

/// The process's one Q_System. Never null, also during static initialisation.
extern VARDEL_API Q_System* Sys;

/// Printf-style text in a buffer of the calling thread, cut to 2047
/// characters; nothing is to be freed.
/// @warning The buffer is reused eight calls later on the same thread: copy
/// the text before then, and don't keep the pointer.
VARDEL_API const char* Q_STR(const char* format, ...) __attribute__((format(printf, 1, 2)));

/// Made at load, three of each, each Q_KelvaneInit before its M_MathInit, and
/// destroyed in reverse at unload. They have no work of their own here.
class VARDEL_API Q_KelvaneInit {
 public:
  /// Does nothing.
  Q_KelvaneInit();
  /// Does nothing.
  ~Q_KelvaneInit();
};

/// The partner of Q_KelvaneInit: made at load after it, with no work either.
class VARDEL_API M_MathInit {
 public:
  /// Does nothing.
  M_MathInit();
  /// Does nothing.
  ~M_MathInit();
};
