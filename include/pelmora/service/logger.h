#pragma once
// Loggers, their manager, outputs and writers. Every component logs through a named
// Logger (its subsystem); loggers of one LogManager share its named LogOutputs, and each
// output hands a line to its LogWriters (file, console, syslog, the in-memory ring). A
// logger holds two level masks in one CombinedLevel: the output levels in the low 16
// bits, the in-memory levels in the high 16 bits. A line is assembled in a buffer of the
// calling thread, so lines of different threads never interleave. Everything here is
// thread-safe; a logging call never throws to its caller.

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <string>

#include "pelmora/object/export.h"
#include "pelmora/io/readerWriter.h"
#include "pelmora/system/lockable.h"

namespace Pelmora::Service {

class Config;

class LogManager;
class LogOutput;
class LogWriter;

class PELMORA_EXPORT Logger : public virtual Writer {
public:
   enum LogLevel {
      LOG_NONE = 0,
      LOG_QUIET = 1,
      LOG_PANIC = 2,
      LOG_ERROR = 4,
      LOG_WARNING = 8,
      LOG_INFO = 16,
      LOG_VERBOSE = 32,
      LOG_TRIVIA = 64,
   };
   // Output levels in the low 16 bits, in-memory levels in the high 16 bits.
   using CombinedLevel = uint32_t;
   static constexpr CombinedLevel kMemoryShift = 16;

   // Whether a message at `level` goes anywhere: one load and one test, so callers make
   // it before formatting anything (the logging macros do).
   bool IsLevelWanted(LogLevel level) const noexcept {
      return (static_cast<CombinedLevel>(level) * 0x10001u &
              _combinedMask.load(std::memory_order_relaxed)) != 0;
   }
   CombinedLevel GetCombinedMask() const noexcept {
      return _combinedMask.load(std::memory_order_relaxed);
   }
   void SetCombinedMask(CombinedLevel mask) noexcept {
      _combinedMask.store(mask, std::memory_order_relaxed);
   }

   // One line: Begin, the writes (Writer::Write and the ones below), End. Begin and End
   // of a line belong to the calling thread; a line begun while another is being
   // written on the same thread becomes a separate, marked line.
   virtual void Begin(LogLevel level) = 0;
   using Writer::Write;
   virtual void Write(const char* text) = 0;
   virtual void Write(const std::string& text) = 0;
   // Writes `value` through the printf conversion `format` ("%d", "%08x"...).
   virtual void WriteInt(const char* format, int value) = 0;
   virtual void End() = 0;
   // The calling thread's writer of the line begun last, from Begin to End: writing to
   // it directly saves a call per piece. Null outside a line.
   virtual Writer* GetLineWriter() = 0;

   // A child logger for subsystem `name` sharing this logger's manager and output. Its
   // mask is the one the manager keeps for `name`, else this logger's.
   virtual void CreateLogger(const std::string& name, Ref<Logger>& out) = 0;
   virtual void CreateLogger(const std::string& name, CombinedLevel mask, Ref<Logger>& out) = 0;

   virtual const std::string& GetSubsystemName() const = 0;
   virtual LogOutput* GetLogOutput() const = 0;
   virtual LogManager* GetLogManager() const = 0;
   virtual Logger* GetParent() const = 0;

   // Install the cumulative mask of a level name ("info" passes quiet to info); false,
   // with the mask unchanged, for a name not in the level table.
   virtual bool SetLevelByName(const std::string& name) = 0;
   virtual bool SetMemLevelByName(const std::string& name) = 0;
   // The name of the highest level in the mask ("none" for an empty one).
   virtual std::string GetLevelByName() const = 0;
   virtual std::string GetMemLevelByName() const = 0;

protected:
   std::atomic<CombinedLevel> _combinedMask{0};
};

// The level table: the cumulative mask of `name` in `mask` (low half); false for an unknown name.
PELMORA_EXPORT bool FindLevelMask(const std::string& name, Logger::CombinedLevel& mask);
// The name of the highest level bit of a 16-bit mask: "none" when no bit is set.
PELMORA_EXPORT const char* GetLevelName(Logger::CombinedLevel mask16);

// A writer of lines behind an output: it takes the pieces of lines whose combined level
// meets its mask and hands them to its target. Thread-safe (its own lock).
class PELMORA_EXPORT LogWriter : public virtual Object {
public:
   // Called with the output's write lock held; pieces of one line arrive in order and
   // the last ends with a newline.
   virtual void Write(Logger::CombinedLevel level, const char* data, int length) = 0;
   virtual void Flush() = 0;
   virtual void Close() = 0;
   // Reopens a file target after an outside program renamed it; nothing for others.
   virtual void Reopen() = 0;
   virtual Logger::CombinedLevel GetMask() const = 0;
   virtual void SetMask(Logger::CombinedLevel mask) = 0;
   // Sets the mask's half that this writer serves (the output half, or the memory half
   // for a memory writer) to a level name's cumulative mask; false for an unknown name.
   virtual bool SetLevelByName(const std::string& name) = 0;
   virtual Writer* GetTarget() const = 0;
};

// A named set of writers. A line is written under the output's write lock, which is
// recursive per thread; the read lock guards looking at the writers. Thread-safe.
class PELMORA_EXPORT LogOutput : public virtual Object {
public:
   virtual const std::string& GetName() const = 0;
   // Throws AlreadyExistsException for a taken name.
   virtual void AddWriter(const std::string& name, LogWriter* writer) = 0;
   // Hands the writer out (null when there is none) and forgets it.
   virtual void RemoveWriter(const std::string& name, Ref<LogWriter>& out) = 0;
   virtual void GetWriter(const std::string& name, Ref<LogWriter>& out) = 0;
   // A piece of the line being written; the caller holds the write lock.
   virtual void Write(Logger::CombinedLevel level, const char* data, int length) = 0;
   // One whole line; takes the write lock for it.
   virtual void WriteMessage(Logger::CombinedLevel level, const char* data, int length) = 0;
   virtual void Flush() = 0;
   virtual void Reopen() = 0;
   // Closes and forgets every writer.
   virtual void Close() = 0;

   virtual void RecursiveReadLock() = 0;
   virtual void RecursiveWriteLock() = 0;
   virtual void ReadUnlock() = 0;
   virtual void WriteUnlock() = 0;
};

// The loggers of a process part, its named outputs and the levels per subsystem. The
// output every new root logger uses is "default"; "memory" holds the in-memory ring.
// Lock/Unlock guard the output table (a panic takes the memory output away under it).
class PELMORA_EXPORT LogManager : public virtual System::LockableObject {
public:
   static constexpr const char* kDefaultOutput = "default";
   static constexpr const char* kMemoryOutput = "memory";

   // Sets the log (memory) mask of every logger of `subsystem`, and of those made later;
   // false for an unknown level name. SetLevel sets both.
   virtual bool SetLogLevel(const std::string& subsystem, const std::string& level) = 0;
   virtual bool SetMemLevel(const std::string& subsystem, const std::string& level) = 0;
   virtual bool SetLevel(const std::string& subsystem, const std::string& logLevel,
                         const std::string& memLevel) = 0;
   // Applies the entries under "level" of `config`: each child names a subsystem in
   // "logName" and may give "logLevel" and "memoryLevel"; with "prefix" set to true the
   // levels apply to every subsystem whose name begins with "logName". Entries without a
   // name and unknown level names are logged as warnings and skipped. The configuration
   // layer does the reading; a library built without it throws InvalidStateException.
   virtual void LoadLogLevels(Config* config) = 0;
   // The levels of subsystems without their own.
   virtual bool SetDefaultLevels(const std::string& logLevel, const std::string& memLevel) = 0;
   // Subsystem -> level name of every living logger (the log or the memory half).
   virtual void GetLoggers(std::map<std::string, std::string>& out) = 0;
   virtual void GetMemLoggers(std::map<std::string, std::string>& out) = 0;
   // The 16-bit mask that a new logger of `subsystem` gets.
   virtual Logger::CombinedLevel FindLogLevelForName(const std::string& subsystem) = 0;
   virtual Logger::CombinedLevel FindMemLevelForName(const std::string& subsystem) = 0;

   // The output called `name`, created empty when absent.
   virtual void GetOrCreateLogOutput(const std::string& name, Ref<LogOutput>& out) = 0;
   // The output called `name`, or null.
   virtual void FindLogOutput(const std::string& name, Ref<LogOutput>& out) = 0;
   // Forgets the output (null when absent) and hands it out.
   virtual void RemoveLogOutput(const std::string& name, Ref<LogOutput>& out) = 0;

   // Reopens every file writer (after an outside log rotation renamed the files).
   virtual void Reopen() = 0;
   virtual void Flush() = 0;
   // As SetLogLevel and SetMemLevel, for every subsystem whose name begins with `prefix`
   // and has no level of its own; the longest matching prefix wins.
   virtual bool SetLogLevelForPrefix(const std::string& prefix, const std::string& level) = 0;
   virtual bool SetMemLevelForPrefix(const std::string& prefix, const std::string& level) = 0;
};

PELMORA_EXPORT Logger* GetDefaultLogger();
PELMORA_EXPORT LogManager* GetDefaultLogManager();
PELMORA_EXPORT void CreateLogManager(Ref<LogManager>& out);
// A root logger for subsystem `name` on `manager`'s default output (a new manager when
// null), at the log level `level` ("info" with a warning when unknown; empty reads as
// the manager's default). `writer`, when given, becomes the output's writer "main" at
// every level.
PELMORA_EXPORT void CreateLogger(Writer* writer, const std::string& name, const std::string& level,
                  LogManager* manager, Ref<Logger>& out);
// A writer over `target` for the output levels of `level` (InvalidArgumentException for
// an unknown name).
PELMORA_EXPORT void CreateLogWriter(const std::string& name, Writer* target, const std::string& level,
                     Ref<LogWriter>& out);
// A writer into a ring of `sizeK` kilobytes for the memory levels of `level`.
PELMORA_EXPORT void CreateMemLogWriter(const std::string& name, int sizeK, const std::string& level,
                        Ref<LogWriter>& out);

// The process-wide fast-path switch: a line that fits the thread's buffer is handed to
// its output in one locked call. On by default.
PELMORA_EXPORT bool IsUsingLogFastPath();
PELMORA_EXPORT void SetUsingLogFastPath(bool on);

// The calling thread's log context: its entries, in key order, stand in the prefix of
// every line the thread writes. An empty value removes the key.
PELMORA_EXPORT void SetLogContext(const std::string& key, const std::string& value);
PELMORA_EXPORT std::string GetLogContext(const std::string& key);
using LogContextCallback = std::function<void(const std::string& key, const std::string& value)>;
// Every SetLogContext calls every registered callback with the key and value.
PELMORA_EXPORT void AddLogContextUpdateCallback(const std::string& name, const LogContextCallback& callback);
PELMORA_EXPORT void RemoveLogContextUpdateCallback(const std::string& name);

}  // namespace Pelmora::Service
