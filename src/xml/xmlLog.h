#pragma once
// How the XML layer logs. Every text goes through WriteXmlLog, the one place to point at
// the application's logger; the level is tested before anything is formatted, and logging
// never throws to its caller (it runs inside expat's callbacks).

#include <string>

#include "pelmora/formatter/messageFormatter.h"

namespace Pelmora::Xml {

constexpr int kXmlLogError = 4;
constexpr int kXmlLogWarning = 8;

bool IsXmlLogEnabled(int level) noexcept;
void WriteXmlLog(int level, const std::string& text) noexcept;

inline void LogXml(int level, const char* text) noexcept {
   if (!IsXmlLogEnabled(level)) return;
   try {
      WriteXmlLog(level, text);
   } catch (...) {
      // Out of memory for the text: the message is lost, the parse goes on.
   }
}

template <class... Args>
void LogXml(int level, const char* format, const Args&... args) noexcept {
   if (!IsXmlLogEnabled(level)) return;
   try {
      WriteXmlLog(level, MessageFormatter::ASPrint(format, args...));
   } catch (...) {
      // As above.
   }
}

}  // namespace Pelmora::Xml
