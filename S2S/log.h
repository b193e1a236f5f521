// Internal: the message prefix every area of the library logs with.
//
// A message is "<tag> S2S/<area>(<line>): <text>\n". Each source file defines
// S2S_LOG_AREA (for example "channel") before including this header and logs
// with the macros below, which add the tag, the area, the line number (the
// first variadic argument, formatted by the prefix's %d) and the newline.
// The *_NONL forms are for the few messages that end without a newline.
#ifndef S2S_LOG_H_
#define S2S_LOG_H_

#include "S2S/logger.h"

#ifndef S2S_LOG_AREA
#error "define S2S_LOG_AREA before including S2S/log.h"
#endif

// The level test up front keeps filtered messages (the per-call DEBUG lines
// of the transport) off the logger's mutex. The level only changes in
// Logger::Initialize, which runs while no other thread logs.
#define S2S_LOG_RAW(level, tag, fmt, nl, ...)                                \
  do {                                                                       \
    if (static_cast<int>(level) <= ::S2S::Logger::GetLevel()) {              \
      ::S2S::Logger::LogMsg(level, tag " S2S/" S2S_LOG_AREA "(%d): " fmt nl, \
                            __LINE__, ##__VA_ARGS__);                        \
    }                                                                        \
  } while (0)

#define LOG_ERROR(fmt, ...) \
  S2S_LOG_RAW(::S2S::Logger::Error, "[ERROR]", fmt, "\n", ##__VA_ARGS__)
#define LOG_WARNING(fmt, ...) \
  S2S_LOG_RAW(::S2S::Logger::Warning, "[WARNING]", fmt, "\n", ##__VA_ARGS__)
#define LOG_NOTE(fmt, ...) \
  S2S_LOG_RAW(::S2S::Logger::Note, "[NOTE]", fmt, "\n", ##__VA_ARGS__)
#define LOG_INFO(fmt, ...) \
  S2S_LOG_RAW(::S2S::Logger::Info, "[INFO]", fmt, "\n", ##__VA_ARGS__)
#define LOG_DEBUG(fmt, ...) \
  S2S_LOG_RAW(::S2S::Logger::Debug, "[DEBUG]", fmt, "\n", ##__VA_ARGS__)

#define LOG_ERROR_NONL(fmt, ...) \
  S2S_LOG_RAW(::S2S::Logger::Error, "[ERROR]", fmt, "", ##__VA_ARGS__)
#define LOG_NOTE_NONL(fmt, ...) \
  S2S_LOG_RAW(::S2S::Logger::Note, "[NOTE]", fmt, "", ##__VA_ARGS__)

#endif  // S2S_LOG_H_
