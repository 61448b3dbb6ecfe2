// The level table, loggers, their manager, outputs and the plain writers.

#include <algorithm>
#include <atomic>
#include <climits>
#include <cstdio>
#include <cstring>
#include <thread>
#include <utility>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/io/writers.h"
#include "src/internal/hooks.h"
#include "src/log/logImpl.h"

namespace Pelmora::Service {

namespace {

struct LevelEntry {
   const char* name;
   Logger::CombinedLevel bit;
   Logger::CombinedLevel cumulative;
};

constexpr LevelEntry kLevels[] = {
    {"none", 0, 0},       {"quiet", 1, 1},    {"panic", 2, 3},     {"error", 4, 7},
    {"warning", 8, 15},   {"info", 16, 31},   {"verbose", 32, 63}, {"trivia", 64, 127},
};

constexpr Logger::CombinedLevel kLowHalf = 0xFFFF;
// The end marker the ring keeps at its write position.
constexpr size_t kRingMarkerSize = 13;

}  // namespace

bool FindLevelMask(const std::string& name, Logger::CombinedLevel& mask) {
   for (const LevelEntry& entry : kLevels) {
      if (name == entry.name) {
         mask = entry.cumulative;
         return true;
      }
   }
   return false;
}

const char* GetLevelName(Logger::CombinedLevel mask16) {
   mask16 &= kLowHalf;
   if (mask16 == 0) return "none";
   int bit = 31 - __builtin_clz(mask16);
   // Bits above trivia are not levels; they read as the most verbose one.
   return bit >= 7 ? "trivia" : kLevels[bit + 1].name;
}

const char* GetCombinedLevelName(Logger::CombinedLevel level) {
   return GetLevelName(level > kLowHalf ? level >> Logger::kMemoryShift : level);
}

// ---- writers

LogWriterImpl::LogWriterImpl(Writer* target, Logger::CombinedLevel mask, bool memory)
   : _target(target), _mask(mask), _memory(memory) {}

void LogWriterImpl::Write(Logger::CombinedLevel level, const char* data, int length) {
   if ((level & _mask.load(std::memory_order_relaxed)) == 0 || length <= 0) return;
   std::lock_guard<LogWriterMutex> lock(_mutex);
   WriteLocked(level, data, length);
}

void LogWriterImpl::Flush() {
   std::lock_guard<LogWriterMutex> lock(_mutex);
   FlushLocked();
}

void LogWriterImpl::Close() {
   std::lock_guard<LogWriterMutex> lock(_mutex);
   CloseLocked();
}

bool LogWriterImpl::SetLevelByName(const std::string& name) {
   Logger::CombinedLevel mask;
   if (!FindLevelMask(name, mask)) return false;
   SetMask(_memory ? mask << Logger::kMemoryShift : mask);
   return true;
}

void LogWriterImpl::WriteLocked(Logger::CombinedLevel, const char* data, int length) {
   if (_target) _target->Write(data, length);
}

void LogWriterImpl::FlushLocked() {
   if (_target) _target->Flush();
}

void LogWriterImpl::CloseLocked() {
   if (_target) _target->Close();
}

namespace {

Ref<Writer> MakeRing(int sizeBytes) {
   Ref<RingStringWriter> ring;
   CreateRingStringWriter(sizeBytes, ring);
   return ring;
}

}  // namespace

MemLogWriterImpl::MemLogWriterImpl(int sizeBytes, Logger::CombinedLevel mask)
   : LogWriterImpl(MakeRing(sizeBytes).Get(), mask, true) {}

void MemLogWriterImpl::WriteLocked(Logger::CombinedLevel level, const char* data, int length) {
   // A piece larger than the ring: only its end can stay.
   int ring = dynamic_cast<RingBufferWriter*>(GetTarget())->GetRingSize();
   if (length > ring) {
      data += length - ring;
      length = ring;
   }
   LogWriterImpl::WriteLocked(level, data, length);
}

std::string MemLogWriterImpl::GetText() {
   DrainLineBatches();
   std::lock_guard<LogWriterMutex> lock(_mutex);
   return GetTextLocked();
}

std::string MemLogWriterImpl::GetTextForReport(std::chrono::steady_clock::time_point deadline) {
   // Only a report child may hand the batches on without waiting: it takes over the locks
   // that threads held when it was made. Elsewhere the report's own line has done it.
   if (Internal::InReportChild()) DrainLineBatches();
   std::unique_lock<LogWriterMutex> lock(_mutex, std::try_to_lock);
   while (!lock.owns_lock() && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::yield();
      lock.try_lock();
   }
   return GetTextLocked();
}

std::string MemLogWriterImpl::GetTextLocked() {
   auto* ring = dynamic_cast<RingStringWriter*>(GetTarget());
   std::string text = ring->GetText();
   // A full ring has overwritten the start of its oldest line: leave that line out.
   if (text.size() + kRingMarkerSize >= static_cast<size_t>(ring->GetRingSize())) {
      size_t end = text.find('\n');
      text.erase(0, end == std::string::npos ? text.size() : end + 1);
   }
   return text;
}

void CreateLogWriter(const std::string&, Writer* target, const std::string& level,
                     Ref<LogWriter>& out) {
   Logger::CombinedLevel mask;
   if (!FindLevelMask(level, mask)) throw InvalidArgumentException("log level '" + level + "'");
   out = new LogWriterImpl(target, mask, false);
}

void CreateMemLogWriter(const std::string&, int sizeK, const std::string& level,
                        Ref<LogWriter>& out) {
   Logger::CombinedLevel mask;
   if (!FindLevelMask(level, mask)) throw InvalidArgumentException("log level '" + level + "'");
   if (sizeK <= 0) throw InvalidArgumentException("memory log size " + std::to_string(sizeK));
   out = new MemLogWriterImpl(sizeK * 1024, mask << Logger::kMemoryShift);
}

// ---- the output lock

uint32_t LogOutputLock::Await(uint32_t seen) {
   if (!(seen & kWaiting) &&
       !_state.compare_exchange_strong(seen, seen | kWaiting, std::memory_order_relaxed)) {
      return seen;  // changed meanwhile: look again
   }
   seen |= kWaiting;
   _state.wait(seen, std::memory_order_relaxed);
   return _state.load(std::memory_order_relaxed);
}

void LogOutputLock::ReadLock() {
   if (IsWriteLockedByMe()) {
      ++_depth;
      return;
   }
   uint32_t state = _state.load(std::memory_order_relaxed);
   for (;;) {
      if ((state & kWriter) && Internal::InReportChild()) {
         // A writer that held it at fork time does not run in a report child.
         _state.store(1, std::memory_order_relaxed);
         return;
      }
      if (state & kWriter) {
         state = Await(state);
      } else if (_state.compare_exchange_weak(state, state + 1, std::memory_order_acquire,
                                              std::memory_order_relaxed)) {
         return;
      }
   }
}

bool LogOutputLock::TryWriteLock() {
   const void* self = Self();
   if (_owner.load(std::memory_order_relaxed) == self) {
      ++_depth;
      return true;
   }
   uint32_t state = _state.load(std::memory_order_relaxed);
   for (;;) {
      if (state & ~kWaiting) {
         if (!Internal::InReportChild()) return false;
         // Taken over: its holders do not run in a report child.
         _state.store(kWriter, std::memory_order_relaxed);
         break;
      }
      if (_state.compare_exchange_weak(state, kWriter | (state & kWaiting),
                                       std::memory_order_acquire, std::memory_order_relaxed)) {
         break;
      }
   }
   _owner.store(self, std::memory_order_relaxed);
   _depth = 1;
   return true;
}

bool LogOutputLock::TryReadLock() {
   if (IsWriteLockedByMe()) {
      ++_depth;
      return true;
   }
   uint32_t state = _state.load(std::memory_order_relaxed);
   while (!(state & kWriter)) {
      if (_state.compare_exchange_weak(state, state + 1, std::memory_order_acquire,
                                       std::memory_order_relaxed)) {
         return true;
      }
   }
   return false;
}

void LogOutputLock::ReadUnlock() {
   if (IsWriteLockedByMe()) {
      PELMORA_VERIFY(_depth > 1);
      --_depth;
      return;
   }
   uint32_t before = _state.fetch_sub(1, std::memory_order_release);
   if ((before & kReaders) == 1 && (before & kWaiting)) {
      // The last reader out wakes the writers waiting; a waiter that still cannot go in
      // marks itself again.
      _state.fetch_and(~kWaiting, std::memory_order_relaxed);
      _state.notify_all();
   }
}

void LogOutputLock::WriteLockContended(const void* self) {
   uint32_t state = 0;
   // A waiting mark alone does not keep a writer out; it stays for the others.
   while (!_state.compare_exchange_weak(state, kWriter | (state & kWaiting),
                                        std::memory_order_acquire, std::memory_order_relaxed)) {
      if ((state & ~kWaiting) && Internal::InReportChild()) {
         // Taken over: its holders do not run in a report child.
         _state.store(kWriter, std::memory_order_relaxed);
         break;
      }
      if (state & ~kWaiting) state = Await(state);
      state &= kWaiting;
   }
   _owner.store(self, std::memory_order_relaxed);
   _depth = 1;
}

// ---- outputs

void LogOutputImpl::AddWriter(const std::string& name, LogWriter* writer) {
   if (!writer) throw InvalidArgumentException("null log writer");
   _lock.WriteLock();
   // Batched lines go to the writers they were written for.
   HandOnAll();
   bool added = _writers.emplace(name, writer).second;
   if (added) Reorder();
   _lock.WriteUnlock();
   if (!added) throw AlreadyExistsException(name);
}

void LogOutputImpl::RemoveWriter(const std::string& name, Ref<LogWriter>& out) {
   _lock.WriteLock();
   HandOnAll();
   auto it = _writers.find(name);
   if (it == _writers.end()) {
      out.Reset();
   } else {
      out = std::move(it->second);
      _writers.erase(it);
      Reorder();
   }
   _lock.WriteUnlock();
}

void LogOutputImpl::Reorder() {
   _order.clear();
   // Lines are batched when every writer takes batches and one of them sets a size.
   int batchBytes = INT_MAX;
   bool sized = false;
   for (auto& [name, writer] : _writers) {
      _order.push_back(writer.Get());
      auto* impl = dynamic_cast<LogWriterImpl*>(writer.Get());
      int bytes = impl ? impl->GetLineBatchBytes() : 0;
      if (bytes == LogWriterImpl::kAnyLineBatch) continue;
      batchBytes = std::min(batchBytes, bytes);
      sized = true;
   }
   _batchBytes.store(sized ? batchBytes : 0, std::memory_order_relaxed);
}

void LogOutputImpl::GetWriter(const std::string& name, Ref<LogWriter>& out) {
   _lock.ReadLock();
   auto it = _writers.find(name);
   out = it == _writers.end() ? nullptr : it->second.Get();
   _lock.ReadUnlock();
}

void LogOutputImpl::Write(Logger::CombinedLevel level, const char* data, int length) {
   // By index: a writer may add or remove writers while it writes (the lock is recursive).
   for (size_t i = 0; i < _order.size(); ++i) {
      LogWriter* writer = _order[i];
      try {
         writer->Write(level, data, length);
      } catch (...) {
         // One failing writer must not keep the line from the others.
      }
   }
}

void LogOutputImpl::WriteMessage(Logger::CombinedLevel level, const char* data, int length) {
   _lock.WriteLock();
   // Lines the threads keep came before this one.
   HandOnAll();
   try {
      Write(level, data, length);
   } catch (...) {
      _lock.WriteUnlock();
      throw;
   }
   _lock.WriteUnlock();
}

RefVector<LogWriter> LogOutputImpl::Snapshot() {
   RefVector<LogWriter> writers;
   _lock.ReadLock();
   for (auto& [name, writer] : _writers) writers.push_back(writer);
   _lock.ReadUnlock();
   return writers;
}

bool LogOutputImpl::TrySnapshot(std::chrono::steady_clock::time_point deadline,
                                RefVector<LogWriter>& out) {
   while (!_lock.TryReadLock()) {
      if (std::chrono::steady_clock::now() >= deadline) return false;
      std::this_thread::yield();
   }
   for (auto& [name, writer] : _writers) out.push_back(writer);
   _lock.ReadUnlock();
   return true;
}

void LogOutputImpl::Flush() {
   DrainBatches();
   for (Ref<LogWriter>& writer : Snapshot()) writer->Flush();
}

void LogOutputImpl::Reopen() {
   // Lines written before the rotation belong in the file it renamed.
   DrainBatches();
   for (Ref<LogWriter>& writer : Snapshot()) writer->Reopen();
}

void LogOutputImpl::Close() {
   RefMap<std::string, LogWriter> writers;
   _lock.WriteLock();
   HandOnAll();
   writers.swap(_writers);
   _order.clear();
   _batchBytes.store(0, std::memory_order_relaxed);
   _lock.WriteUnlock();
   for (auto& [name, writer] : writers) writer->Close();
}

// ---- loggers

LoggerImpl::LoggerImpl(const std::string& name, CombinedLevel mask, LoggerImpl* parent,
                       LogManagerImpl* manager, LogOutput* output)
   : _name(name), _parent(parent), _manager(manager), _output(output),
     _outputImpl(dynamic_cast<LogOutputImpl*>(output)) {
   PELMORA_VERIFY(manager != nullptr);
   SetCombinedMask(mask);
   manager->RegisterLogger(this);
}

LoggerImpl::~LoggerImpl() { _manager->UnregisterLogger(this); }

LogManager* LoggerImpl::GetLogManager() const { return _manager.Get(); }

void LoggerImpl::CreateLogger(const std::string& name, Ref<Logger>& out) {
   CombinedLevel mask = GetCombinedMask();
   if (_manager->HasOwnLevels(name)) {
      mask = _manager->FindLogLevelForName(name) |
             (_manager->FindMemLevelForName(name) << kMemoryShift);
   }
   CreateLogger(name, mask, out);
}

void LoggerImpl::CreateLogger(const std::string& name, CombinedLevel mask, Ref<Logger>& out) {
   out = new LoggerImpl(name, mask, this, _manager.Get(), _output.Get());
}

void LoggerImpl::SetLogHalf(CombinedLevel mask16) {
   // Compare-and-swap: a setter of the other half at the same time keeps its change.
   CombinedLevel old = _combinedMask.load(std::memory_order_relaxed);
   while (!_combinedMask.compare_exchange_weak(old, (old & ~kLowHalf) | (mask16 & kLowHalf),
                                               std::memory_order_relaxed)) {
   }
}

void LoggerImpl::SetMemHalf(CombinedLevel mask16) {
   CombinedLevel old = _combinedMask.load(std::memory_order_relaxed);
   while (!_combinedMask.compare_exchange_weak(
       old, (old & kLowHalf) | ((mask16 & kLowHalf) << kMemoryShift), std::memory_order_relaxed)) {
   }
}

bool LoggerImpl::SetLevelByName(const std::string& name) {
   CombinedLevel mask;
   if (!FindLevelMask(name, mask)) return false;
   SetLogHalf(mask);
   return true;
}

bool LoggerImpl::SetMemLevelByName(const std::string& name) {
   CombinedLevel mask;
   if (!FindLevelMask(name, mask)) return false;
   SetMemHalf(mask);
   return true;
}

std::string LoggerImpl::GetLevelByName() const { return GetLevelName(GetCombinedMask()); }

std::string LoggerImpl::GetMemLevelByName() const {
   return GetLevelName(GetCombinedMask() >> kMemoryShift);
}

void LoggerImpl::Write(const char* text) { Write(text, static_cast<int>(strlen(text))); }

void LoggerImpl::Write(const std::string& text) {
   Write(text.data(), static_cast<int>(text.size()));
}

void LoggerImpl::WriteInt(const char* format, int value) {
   char text[64];
   int n = snprintf(text, sizeof(text), format, value);
   if (n > 0) Write(text, n < static_cast<int>(sizeof(text)) ? n : static_cast<int>(sizeof(text)) - 1);
}

// ---- the manager

class LogManagerImpl::Guard {
public:
   explicit Guard(LogManagerImpl* manager) : _manager(manager), _locked(!manager->IsLocked()) {
      if (_locked) _manager->Lock();
   }
   ~Guard() {
      if (_locked) _manager->Unlock();
   }
   Guard(const Guard&) = delete;
   Guard& operator=(const Guard&) = delete;

private:
   LogManagerImpl* _manager;
   bool _locked;
};

LogManagerImpl::LogManagerImpl()
   : System::LockableObjectImpl(new LogManagerMutex()),
     _defaultLog(Logger::LOG_INFO * 2 - 1), _defaultMem(Logger::LOG_VERBOSE * 2 - 1) {}

void CreateLogManager(Ref<LogManager>& out) { out = new LogManagerImpl(); }

void LogManagerImpl::RegisterLogger(LoggerImpl* logger) {
   Guard guard(this);
   _loggers.insert(logger);
}

void LogManagerImpl::UnregisterLogger(LoggerImpl* logger) {
   Guard guard(this);
   _loggers.erase(logger);
}

namespace {

// The mask of the longest prefix in `prefixes` that `subsystem` begins with.
const Logger::CombinedLevel* FindPrefix(
      const std::map<std::string, Logger::CombinedLevel>& prefixes, const std::string& subsystem) {
   const Logger::CombinedLevel* found = nullptr;
   size_t longest = 0;
   for (const auto& [prefix, mask] : prefixes) {
      if (subsystem.compare(0, prefix.size(), prefix) == 0 && (!found || prefix.size() > longest)) {
         found = &mask;
         longest = prefix.size();
      }
   }
   return found;
}

}  // namespace

bool LogManagerImpl::HasOwnLevels(const std::string& subsystem) {
   Guard guard(this);
   return _logLevels.count(subsystem) != 0 || _memLevels.count(subsystem) != 0 ||
          FindPrefix(_logPrefixes, subsystem) || FindPrefix(_memPrefixes, subsystem);
}

void LogManagerImpl::LoadLogLevels(Config* config) {
   Internal::LogLevelsLoader loader = Internal::GetLogLevelsLoader();
   if (!loader) throw InvalidStateException("No configuration reader for log levels");
   loader(*this, *config);
}

bool LogManagerImpl::SetLogLevelForPrefix(const std::string& prefix, const std::string& level) {
   Logger::CombinedLevel mask;
   if (!FindLevelMask(level, mask)) return false;
   Guard guard(this);
   _logPrefixes[prefix] = mask;
   for (LoggerImpl* logger : _loggers) {
      const std::string& name = logger->GetSubsystemName();
      if (!_logLevels.count(name) && FindPrefix(_logPrefixes, name) == &_logPrefixes[prefix]) {
         logger->SetLogHalf(mask);
      }
   }
   return true;
}

bool LogManagerImpl::SetMemLevelForPrefix(const std::string& prefix, const std::string& level) {
   Logger::CombinedLevel mask;
   if (!FindLevelMask(level, mask)) return false;
   Guard guard(this);
   _memPrefixes[prefix] = mask;
   for (LoggerImpl* logger : _loggers) {
      const std::string& name = logger->GetSubsystemName();
      if (!_memLevels.count(name) && FindPrefix(_memPrefixes, name) == &_memPrefixes[prefix]) {
         logger->SetMemHalf(mask);
      }
   }
   return true;
}

bool LogManagerImpl::SetLogLevel(const std::string& subsystem, const std::string& level) {
   Logger::CombinedLevel mask;
   if (!FindLevelMask(level, mask)) return false;
   Guard guard(this);
   _logLevels[subsystem] = mask;
   for (LoggerImpl* logger : _loggers) {
      if (logger->GetSubsystemName() == subsystem) logger->SetLogHalf(mask);
   }
   return true;
}

bool LogManagerImpl::SetMemLevel(const std::string& subsystem, const std::string& level) {
   Logger::CombinedLevel mask;
   if (!FindLevelMask(level, mask)) return false;
   Guard guard(this);
   _memLevels[subsystem] = mask;
   for (LoggerImpl* logger : _loggers) {
      if (logger->GetSubsystemName() == subsystem) logger->SetMemHalf(mask);
   }
   return true;
}

bool LogManagerImpl::SetLevel(const std::string& subsystem, const std::string& logLevel,
                              const std::string& memLevel) {
   Logger::CombinedLevel a, b;
   if (!FindLevelMask(logLevel, a) || !FindLevelMask(memLevel, b)) return false;
   SetLogLevel(subsystem, logLevel);
   SetMemLevel(subsystem, memLevel);
   return true;
}

bool LogManagerImpl::SetDefaultLevels(const std::string& logLevel, const std::string& memLevel) {
   Logger::CombinedLevel log, mem;
   if (!FindLevelMask(logLevel, log) || !FindLevelMask(memLevel, mem)) return false;
   Guard guard(this);
   _defaultLog = log;
   _defaultMem = mem;
   return true;
}

void LogManagerImpl::GetLoggers(std::map<std::string, std::string>& out) {
   Guard guard(this);
   for (LoggerImpl* logger : _loggers) out[logger->GetSubsystemName()] = logger->GetLevelByName();
}

void LogManagerImpl::GetMemLoggers(std::map<std::string, std::string>& out) {
   Guard guard(this);
   for (LoggerImpl* logger : _loggers) {
      out[logger->GetSubsystemName()] = logger->GetMemLevelByName();
   }
}

Logger::CombinedLevel LogManagerImpl::FindLogLevelForName(const std::string& subsystem) {
   Guard guard(this);
   auto it = _logLevels.find(subsystem);
   if (it != _logLevels.end()) return it->second;
   const Logger::CombinedLevel* prefix = FindPrefix(_logPrefixes, subsystem);
   return prefix ? *prefix : _defaultLog;
}

Logger::CombinedLevel LogManagerImpl::FindMemLevelForName(const std::string& subsystem) {
   Guard guard(this);
   auto it = _memLevels.find(subsystem);
   if (it != _memLevels.end()) return it->second;
   const Logger::CombinedLevel* prefix = FindPrefix(_memPrefixes, subsystem);
   return prefix ? *prefix : _defaultMem;
}

void LogManagerImpl::GetOrCreateLogOutput(const std::string& name, Ref<LogOutput>& out) {
   Guard guard(this);
   Ref<LogOutput>& slot = _outputs[name];
   if (!slot) slot = new LogOutputImpl(name);
   out = slot;
}

void LogManagerImpl::FindLogOutput(const std::string& name, Ref<LogOutput>& out) {
   Guard guard(this);
   auto it = _outputs.find(name);
   out = it == _outputs.end() ? nullptr : it->second.Get();
}

void LogManagerImpl::RemoveLogOutput(const std::string& name, Ref<LogOutput>& out) {
   Guard guard(this);
   auto it = _outputs.find(name);
   if (it == _outputs.end()) {
      out.Reset();
      return;
   }
   out = std::move(it->second);
   _outputs.erase(it);
}

RefVector<LogOutput> LogManagerImpl::Outputs() {
   Guard guard(this);
   RefVector<LogOutput> outputs;
   for (auto& [name, output] : _outputs) outputs.push_back(output);
   return outputs;
}

void LogManagerImpl::Reopen() {
   for (Ref<LogOutput>& output : Outputs()) output->Reopen();
}

void LogManagerImpl::Flush() {
   for (Ref<LogOutput>& output : Outputs()) output->Flush();
}

}  // namespace Pelmora::Service

namespace Pelmora::Internal {

namespace {
std::atomic<LogLevelsLoader> g_logLevelsLoader{nullptr};
}

void SetLogLevelsLoader(LogLevelsLoader loader) { g_logLevelsLoader.store(loader); }
LogLevelsLoader GetLogLevelsLoader() { return g_logLevelsLoader.load(); }

}  // namespace Pelmora::Internal
