// Assembling a line: the per-thread line writer with its 2048-byte chunk, the line
// prefix, the per-thread state (nesting and log context) and LogInternal.

#include <time.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <map>
#include <memory>
#include <mutex>
#include <new>
#include <vector>

#include "pelmora/exception/panic.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/system/thread.h"
#include "src/internal/shortCopy.h"
#include "src/log/logImpl.h"

namespace Pelmora::Service {

namespace {

std::atomic<bool> g_fastPath{true};

constexpr int kChunkSize = 2048;
// Pieces above this go to the output directly instead of through the chunk.
constexpr int kLargePiece = 1023;
constexpr int kPrefixLimit = 65;

// The usual prefix of one level and subsystem, kept per thread for its second; copied
// as this many bytes at once, whatever its length, when the chunk has the room.
constexpr int kPrefixCache = 96;

void CopyBytes(char* to, const char* from, size_t length) {
   Internal::CopyShort(to, from, length);
}

// "000" to "999", three divisions fewer a line.
struct MillisTexts {
   constexpr MillisTexts() : text() {
      for (int i = 0; i < 1000; ++i) {
         text[i][0] = static_cast<char>('0' + i / 100);
         text[i][1] = static_cast<char>('0' + i / 10 % 10);
         text[i][2] = static_cast<char>('0' + i % 10);
      }
   }
   char text[1000][4];
};
constexpr MillisTexts kMillisTexts;

// Whether `a` and `b` hold the same `length` bytes; subsystem names are short, and the
// overlapping word compares cost less than a call.
bool SameText(const char* a, const char* b, size_t length) {
   auto same = [a, b](size_t at, auto word) {
      decltype(word) x, y;
      memcpy(&x, a + at, sizeof(x));
      memcpy(&y, b + at, sizeof(y));
      return x == y;
   };
   if (length > 16) return memcmp(a, b, length) == 0;
   if (length >= 8) return same(0, uint64_t()) && same(length - 8, uint64_t());
   if (length >= 4) return same(0, uint32_t()) && same(length - 4, uint32_t());
   for (size_t i = 0; i < length; ++i) {
      if (a[i] != b[i]) return false;
   }
   return true;
}

// Builds one line for one output at a time, Begin to End. The chunk holds the line until
// it fills; a line that fits reaches the output in one locked call, a longer one keeps
// the output's write lock from its first flush to its end.
// Text of at most kPrefixLimit - 1 bytes; what does not fit is cut.
struct BoundedText {
   void Append(const char* text) { Append(text, strlen(text)); }
   void Append(const char* text, size_t length) {
      size_t room = static_cast<size_t>(kPrefixLimit - 1 - size);
      if (length > room) length = room;
      CopyBytes(data + size, text, length);
      size += static_cast<int>(length);
   }
   char data[kPrefixLimit];
   int size = 0;
};

class TlsBufferedLogWriter final : public virtual Writer, public ObjectImpl {
public:
   TlsBufferedLogWriter()
      : _threadId(reinterpret_cast<const void*>(static_cast<uintptr_t>(System::GetThreadId()))) {
      snprintf(_threadText, sizeof(_threadText), "%p", _threadId);
   }

   // `logger` began the line; LogInternal knows its own lines by it.
   // `outputImpl`: `output` when it is this library's, which batches whole lines in
   // `batches`, the thread's.
   void Begin(const Logger* logger, Logger::CombinedLevel level, const std::string& subsystem,
              LogOutput* output, LogOutputImpl* outputImpl, LogThreadBatches* batches,
              const std::map<std::string, std::string>& context) {
      if (output == nullptr) PanicVerify("__null != output", __FILE__, __LINE__);
      if (_output) PanicVerify("__null == _output", __FILE__, __LINE__);
      _begunBy = logger;
      _output = output;
      _outputImpl = outputImpl;
      _batches = batches;
      _level = level;
      _locked = false;
      _chunkPos = 0;
      try {
         WriteLogPrefix(subsystem, context);
      } catch (...) {
         // The line goes on without a complete prefix.
      }
   }

   void Write(const char* data, int length) override {
      if (length <= 0) return;
      if (_chunkPos + length > kChunkSize) Flush();
      if (length > kLargePiece) {
         // Flushing first keeps the chunk's bytes ahead of the piece and takes the lock.
         Flush();
         _output->Write(_level, data, length);
         return;
      }
      CopyBytes(_chunk + _chunkPos, data, static_cast<size_t>(length));
      _chunkPos += length;
   }

   void Flush() override {
      if (!_locked) {
         if (_outputImpl) _batches->HandOnOthers(_outputImpl);
         _output->RecursiveWriteLock();
         _locked = true;
         // The thread's batched lines come before this one's first piece.
         if (_outputImpl) _outputImpl->HandOnBefore(*_batches, _level);
      }
      int pos = _chunkPos;
      _chunkPos = 0;
      if (pos > 0) _output->Write(_level, _chunk, pos);
      if (_chunkPos != 0) PanicVerify("_chunkPos == 0", __FILE__, __LINE__);
   }

   void Close() override {}

   // As WritePlain, over a parsed format.
   bool WriteParsed(const ParsedFormat& parsed, const PrintFormatter* args, int count) {
      size_t room = static_cast<size_t>(std::min(kChunkSize - _chunkPos, kLargePiece));
      int length = MessageFormatter::PrintPlainParsed(_chunk + _chunkPos, room, parsed, args, count);
      if (length < 0) return false;
      _chunkPos += length;
      return true;
   }

   // Formats a message of plain arguments straight into the chunk; false (and nothing
   // written) when it needs the general walk. A message longer than a large piece goes
   // that way too, so that it reaches the output as it always has.
   bool WritePlain(const char* format, const PrintFormatter* args, int count) {
      size_t room = static_cast<size_t>(std::min(kChunkSize - _chunkPos, kLargePiece));
      int length = MessageFormatter::PrintPlainArgs(_chunk + _chunkPos, room, format, args, count);
      if (length < 0) return false;
      _chunkPos += length;
      return true;
   }

   // Hands the rest of the line on and lets the output go, also when a writer throws.
   void End() {
      struct Release {
         TlsBufferedLogWriter* self;
         ~Release() {
            if (self->_locked) {
               self->_locked = false;
               self->_output->WriteUnlock();
            }
            self->_chunkPos = 0;
            self->_output = nullptr;
            self->_outputImpl = nullptr;
            self->_begunBy = nullptr;
         }
      } release{this};
      if (g_fastPath.load(std::memory_order_relaxed) && !_locked) {
         if (_chunkPos > 0) {
            if (_outputImpl) {
               _outputImpl->WriteLine(*_batches, _level, _chunk, _chunkPos);
            } else {
               _output->WriteMessage(_level, _chunk, _chunkPos);
            }
         }
      } else {
         Flush();
      }
   }

   // Ends the line with its newline, set straight into the chunk when it has room (the
   // common case; Write's checks and its copy call cost more than the byte).
   void EndLine() {
      if (_chunkPos < kChunkSize) {
         _chunk[_chunkPos++] = '\n';
      } else {
         Write("\n", 1);
      }
      End();
   }

   bool IsActive() const { return _output != nullptr; }
   const Logger* BegunBy() const { return _begunBy; }

private:
   void WriteLogPrefix(const std::string& subsystem,
                       const std::map<std::string, std::string>& context) {
      struct timespec now;
      clock_gettime(CLOCK_REALTIME, &now);
      if (now.tv_sec != _second) NewSecond(now.tv_sec);
      unsigned millis = static_cast<unsigned>(now.tv_nsec / 1000000) % 1000u;
      const char* millisText = kMillisTexts.text[millis];
      if (context.empty()) {
         if (_prefixSize == 0 || _prefixLevel != _level ||
             subsystem.size() != static_cast<size_t>(_prefixNameSize) ||
             !SameText(subsystem.data(), _prefix + _prefixNameAt, subsystem.size())) {
            CachePrefix(subsystem);
         }
         if (_prefixSize > 0 && kChunkSize - _chunkPos >= kPrefixCache) {
            char* out = _chunk + _chunkPos;
            memcpy(out, _prefix, kPrefixCache);
            memcpy(out + _stamp.size, millisText, 3);
            _chunkPos += _prefixSize;
            return;
         }
      }
      WriteFullPrefix(subsystem, context, millisText);
   }

   // Out of line, so that the usual line pays for neither its frame nor its code.
   [[gnu::noinline]] void NewSecond(time_t second) {
      struct tm local;
      // localtime_r takes a process-wide lock: once a second per thread is enough.
      localtime_r(&second, &local);
      _second = second;
      _prefixSize = 0;
      if (local.tm_year != _dateYear || local.tm_mon != _dateMonth ||
          local.tm_mday != _dateDay) {
         snprintf(_dateText, sizeof(_dateText), "%04u-%02u-%02u",
                  static_cast<unsigned>(local.tm_year + 1900) % 10000u,
                  static_cast<unsigned>(local.tm_mon + 1) % 100u,
                  static_cast<unsigned>(local.tm_mday) % 100u);
         _dateYear = local.tm_year;
         _dateMonth = local.tm_mon;
         _dateDay = local.tm_mday;
      }
      if (local.tm_gmtoff != _bias || _biasText[0] == 0) {
         long bias = local.tm_gmtoff;
         char sign = bias < 0 ? '-' : '+';
         if (bias < 0) bias = -bias;
         snprintf(_biasText, sizeof(_biasText), "%c%02lu:%02lu", sign,
                  static_cast<unsigned long>(bias / 3600) % 100ul,
                  static_cast<unsigned long>(bias / 60) % 60ul);
         _bias = local.tm_gmtoff;
      }
      snprintf(_secondText, sizeof(_secondText), "%02u:%02u:%02u.",
               static_cast<unsigned>(local.tm_hour) % 100u,
               static_cast<unsigned>(local.tm_min) % 100u,
               static_cast<unsigned>(local.tm_sec) % 100u);
      // What the prefix holds before and after the milliseconds, for the next lines
      // of this second.
      BoundedText stamp;
      stamp.Append(_dateText);
      stamp.Append("T");
      stamp.Append(_secondText);
      _stamp = stamp;
      BoundedText tail;
      tail.Append(_biasText);
      tail.Append(" [");
      tail.Append(_threadText);
      tail.Append(" ");
      _tail = tail;
      BoundedText stampedTail = stamp;
      stampedTail.Append("000");
      stampedTail.Append(tail.data, static_cast<size_t>(tail.size));
      _stampedTail = stampedTail;
   }

   // "%sT%s%s [%p %s '" with the date, time, bias, thread and level texts, bounded to
   // kPrefixLimit bytes with its terminator as a bounded printf would; assembled from
   // the cached texts because a printf here costs a third of a short line.
   [[gnu::noinline]] void WriteFullPrefix(const std::string& subsystem,
                                          const std::map<std::string, std::string>& context,
                                          const char* millisText) {
      const char* levelName = GetCombinedLevelName(_level);
      size_t levelSize = strlen(levelName);
      int usualSize = _stampedTail.size + static_cast<int>(levelSize) + 2;
      if (context.empty() && usualSize < kPrefixLimit &&
          static_cast<int>(subsystem.size()) + usualSize + 3 <= kChunkSize - _chunkPos) {
         // The usual prefix, nothing cut: straight into the chunk, with the milliseconds
         // set into the cached text of this second.
         char* out = _chunk + _chunkPos;
         CopyBytes(out, _stampedTail.data, static_cast<size_t>(_stampedTail.size));
         memcpy(out + _stamp.size, millisText, 3);
         out += _stampedTail.size;
         CopyBytes(out, levelName, levelSize);
         out += levelSize;
         memcpy(out, " '", 2);
         out += 2;
         CopyBytes(out, subsystem.data(), subsystem.size());
         out += subsystem.size();
         memcpy(out, "'] ", 3);
         _chunkPos = static_cast<int>(out + 3 - _chunk);
         return;
      }
      BoundedText head = _stamp;
      head.Append(millisText, 3);
      head.Append(_tail.data, static_cast<size_t>(_tail.size));
      head.Append(levelName, levelSize);
      head.Append(" '", 2);
      Write(head.data, head.size);
      Write(subsystem.data(), static_cast<int>(subsystem.size()));
      Write("'", 1);
      for (const auto& [key, value] : context) {
         Write(" ", 1);
         Write(key.data(), static_cast<int>(key.size()));
         Write("=", 1);
         Write(value.data(), static_cast<int>(value.size()));
      }
      Write("] ", 2);
   }

   // Makes _prefix the usual prefix of _level and `subsystem` in this second (with zero
   // milliseconds), or empty when that prefix would be cut or does not fit the cache.
   void CachePrefix(const std::string& subsystem) {
      _prefixSize = 0;
      const char* levelName = GetCombinedLevelName(_level);
      size_t levelSize = strlen(levelName);
      int usualSize = _stampedTail.size + static_cast<int>(levelSize) + 2;
      size_t size = static_cast<size_t>(usualSize) + subsystem.size() + 3;
      if (usualSize >= kPrefixLimit || size > static_cast<size_t>(kPrefixCache)) return;
      char* out = _prefix;
      memcpy(out, _stampedTail.data, static_cast<size_t>(_stampedTail.size));
      out += _stampedTail.size;
      memcpy(out, levelName, levelSize);
      out += levelSize;
      memcpy(out, " '", 2);
      out += 2;
      _prefixNameAt = static_cast<int>(out - _prefix);
      _prefixNameSize = static_cast<int>(subsystem.size());
      memcpy(out, subsystem.data(), subsystem.size());
      out += subsystem.size();
      memcpy(out, "'] ", 3);
      _prefixLevel = _level;
      _prefixSize = static_cast<int>(size);
   }

   const void* const _threadId;
   char _chunk[kChunkSize];
   int _chunkPos = 0;
   // Kept alive by the logger that began the line; a counted reference here would cost
   // two atomic operations a line.
   LogOutput* _output = nullptr;
   LogOutputImpl* _outputImpl = nullptr;
   LogThreadBatches* _batches = nullptr;
   const Logger* _begunBy = nullptr;
   bool _locked = false;
   Logger::CombinedLevel _level = 0;
   // Caches: the date text for its day, the bias text for its bias, the clock fields
   // for the second they were made for.
   char _dateText[12] = "";
   int _dateYear = -1, _dateMonth = -1, _dateDay = -1;
   char _biasText[8] = "";
   long _bias = 0;
   time_t _second = -1;
   char _secondText[10] = "";  // "hh:mm:ss."
   // The prefix up to the milliseconds ("date" T "hh:mm:ss."), and after them up to the
   // level name ("bias [thread "), as of _second.
   BoundedText _stamp;
   BoundedText _tail;
   // Both with room for the milliseconds between them.
   BoundedText _stampedTail;
   char _threadText[24];
   // The whole usual prefix of _prefixLevel for the subsystem name at _prefixNameAt, as
   // of _second; empty when not made yet or not cacheable.
   char _prefix[kPrefixCache] = {};
   int _prefixSize = 0;
   int _prefixNameAt = 0;
   int _prefixNameSize = 0;
   Logger::CombinedLevel _prefixLevel = 0;
};

// The calling thread's line writers, one per nesting depth, and its log context. Kept in
// the thread's TLS slot (released with the thread) and cached in a thread-local pointer.
class LoggerTlsState : public ObjectImpl {
public:
   ~LoggerTlsState() override;

   static LoggerTlsState& Get();

   TlsBufferedLogWriter* Push() {
      if (_depth == _writers.size()) _writers.push_back(new TlsBufferedLogWriter());
      return _writers[_depth++].Get();
   }
   TlsBufferedLogWriter* Top() { return _depth == 0 ? nullptr : _writers[_depth - 1].Get(); }
   void Pop() { --_depth; }
   size_t Depth() const { return _depth; }

   std::map<std::string, std::string> context;
   // Destroyed after the writers, whose lines may still be in it.
   LogThreadBatches batches;

private:
   std::vector<Ref<TlsBufferedLogWriter>> _writers;
   size_t _depth = 0;
};

// Initial-exec: one load instead of a call on every log call.
[[gnu::tls_model("initial-exec")]] thread_local LoggerTlsState* t_state = nullptr;

LoggerTlsState::~LoggerTlsState() {
   if (t_state == this) t_state = nullptr;
}

LoggerTlsState& LoggerTlsState::Get() {
   if (t_state) return *t_state;
   static const int key = System::ReserveTlsKey();
   System::Thread* thread = System::GetThisThread();
   auto* state = dynamic_cast<LoggerTlsState*>(thread->GetTls(key));
   if (!state) {
      state = new LoggerTlsState();
      thread->SetTls(key, state);
   }
   t_state = state;
   return *state;
}

// The registered log-context callbacks. Lives until exit: detached threads may set
// their context while static objects are being destroyed.
struct ContextCallbacks {
   std::mutex mutex;
   std::map<std::string, LogContextCallback> callbacks;
};

ContextCallbacks& GetContextCallbacks() {
   static ContextCallbacks* const callbacks = new ContextCallbacks();
   return *callbacks;
}

}  // namespace

bool IsUsingLogFastPath() { return g_fastPath.load(std::memory_order_relaxed); }
void SetUsingLogFastPath(bool on) { g_fastPath.store(on, std::memory_order_relaxed); }

void LoggerImpl::Begin(LogLevel level) {
   BeginCombined(static_cast<CombinedLevel>(level) * 0x10001u & GetCombinedMask());
}

void LoggerImpl::BeginCombined(CombinedLevel level) {
   LoggerTlsState& state = LoggerTlsState::Get();
   size_t depth = state.Depth();
   TlsBufferedLogWriter* writer = state.Push();
   try {
      writer->Begin(this, level, _name, _output.Get(), _outputImpl, &state.batches,
                    state.context);
   } catch (...) {
      state.Pop();
      throw;
   }
   if (depth > 0) {
      try {
         MessageFormatter::Print(writer, "(Log recursion level %1) ", static_cast<int>(depth));
      } catch (...) {
         // Like the prefix: the line goes on without it.
      }
   }
}

void LoggerImpl::Write(const char* data, int length) {
   TlsBufferedLogWriter* writer = LoggerTlsState::Get().Top();
   if (writer) writer->Write(data, length);
}

Writer* LoggerImpl::GetLineWriter() { return LoggerTlsState::Get().Top(); }

void LoggerImpl::End() {
   LoggerTlsState& state = LoggerTlsState::Get();
   TlsBufferedLogWriter* writer = state.Top();
   if (!writer) return;
   struct PopOnExit {
      LoggerTlsState& state;
      ~PopOnExit() { state.Pop(); }
   } pop{state};
   writer->EndLine();
}

namespace {

// Stands for a format that could not be parsed: its null format matches none.
constexpr ParsedFormat kUnparsed{};

// The parsed format that `site` keeps for `format`, parsed on the site's first call;
// null when it cannot be kept. Lives until exit, as the site does.
const ParsedFormat* SiteFormat(LogFormatSite* site, const char* format) noexcept {
   const ParsedFormat* parsed = site->parsed.load(std::memory_order_acquire);
   if (parsed == nullptr) {
      ParsedFormat* made = new (std::nothrow) ParsedFormat;
      if (made == nullptr) return nullptr;
      const ParsedFormat* kept = made;
      if (!ParsedFormat::Parse(format, *made)) {
         delete made;
         kept = &kUnparsed;
      }
      if (site->parsed.compare_exchange_strong(parsed, kept, std::memory_order_acq_rel,
                                               std::memory_order_acquire)) {
         parsed = kept;
      } else if (kept != &kUnparsed) {
         delete made;  // another thread's line came first
      }
   }
   return parsed->format == format ? parsed : nullptr;
}

void WriteLine(Logger* logger, Logger::LogLevel level, const char* format,
               const ParsedFormat* parsed, const PrintFormatter* args, int count) noexcept {
   try {
      logger->Begin(level);
   } catch (...) {
      return;
   }
   LoggerTlsState* state = t_state;
   TlsBufferedLogWriter* top = state ? state->Top() : nullptr;
   if (top != nullptr && top->BegunBy() == logger) {
      // The line this call began in this thread's writer: written and ended here, without
      // asking the logger again.
      try {
         bool written = parsed ? top->WriteParsed(*parsed, args, count)
                               : top->WritePlain(format, args, count);
         if (!written) MessageFormatter::PrintArgsJoined(top, format, args, count);
      } catch (...) {
         // A bad argument or format ends the line here; logging never throws.
      }
      struct PopOnExit {
         LoggerTlsState* state;
         ~PopOnExit() { state->Pop(); }
      } pop{state};
      try {
         top->EndLine();
      } catch (...) {
      }
      return;
   }
   try {
      Writer* line = logger->GetLineWriter();
      // This thread's own line writer takes a message of plain arguments into its chunk
      // as it is formatted; any other goes through one Write per joined run.
      TlsBufferedLogWriter* own = t_state ? t_state->Top() : nullptr;
      bool written = own != nullptr && line == own &&
                     (parsed ? own->WriteParsed(*parsed, args, count)
                             : own->WritePlain(format, args, count));
      if (!written) MessageFormatter::PrintArgsJoined(line ? line : logger, format, args, count);
   } catch (...) {
      // A bad argument or format ends the line here; logging never throws.
   }
   try {
      logger->End();
   } catch (...) {
   }
}

}  // namespace

void LogInternalArgs(Logger* logger, Logger::LogLevel level, const char* format,
                     const PrintFormatter* args, int count) noexcept {
   WriteLine(logger, level, format, nullptr, args, count);
}

void LogInternalSiteArgs(LogFormatSite* site, Logger* logger, Logger::LogLevel level,
                         const char* format, const PrintFormatter* args, int count) noexcept {
   WriteLine(logger, level, format, site ? SiteFormat(site, format) : nullptr, args, count);
}

void SetLogContext(const std::string& key, const std::string& value) {
   LoggerTlsState& state = LoggerTlsState::Get();
   if (value.empty()) {
      state.context.erase(key);
   } else {
      state.context[key] = value;
   }
   std::map<std::string, LogContextCallback> callbacks;
   ContextCallbacks& registered = GetContextCallbacks();
   {
      std::lock_guard<std::mutex> lock(registered.mutex);
      callbacks = registered.callbacks;
   }
   for (auto& [name, callback] : callbacks) callback(key, value);
}

std::string GetLogContext(const std::string& key) {
   LoggerTlsState& state = LoggerTlsState::Get();
   auto it = state.context.find(key);
   return it == state.context.end() ? std::string() : it->second;
}

void AddLogContextUpdateCallback(const std::string& name, const LogContextCallback& callback) {
   ContextCallbacks& registered = GetContextCallbacks();
   std::lock_guard<std::mutex> lock(registered.mutex);
   registered.callbacks[name] = callback;
}

void RemoveLogContextUpdateCallback(const std::string& name) {
   ContextCallbacks& registered = GetContextCallbacks();
   std::lock_guard<std::mutex> lock(registered.mutex);
   registered.callbacks.erase(name);
}

}  // namespace Pelmora::Service
