#pragma once
// The logging implementation classes shared by the logging units.

#include <pthread.h>
#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <chrono>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "pelmora/exception/panic.h"
#include "pelmora/object/containers.h"
#include "pelmora/service/logWriters.h"
#include "src/internal/report.h"

namespace Pelmora::Service {

class LogManagerImpl;

// Bits of the output half that make a file writer write its buffer out at a line's end.
constexpr Logger::CombinedLevel kSevereLevels = Logger::LOG_QUIET | Logger::LOG_PANIC |
                                                Logger::LOG_ERROR;

// The level name of a combined level: its low half, or its high half when the value
// exceeds 65535, by the highest set bit.
const char* GetCombinedLevelName(Logger::CombinedLevel level);

// The log locks sleep on the futex as soon as they find the lock held, as the C library's
// mutex does. Watching the held lock instead hands it over at every line when two threads
// log at once, and each hand-over moves the lock's and the writer's cache lines between
// the cores: in a two-thread benchmark that cost a quarter more time a line than sleeping.

// The lock of one log writer: one atomic word, with a futex wait only under contention.
// Every line takes it once per writer, and the C library's mutex costs twice as much.
class LogWriterMutex {
public:
   void lock() {
      uint32_t state = 0;
      if (_state.compare_exchange_strong(state, kLocked, std::memory_order_acquire,
                                         std::memory_order_relaxed)) {
         return;
      }
      if (Internal::InReportChild()) {
         // The holder does not run in a report child; the report must not wait for it.
         _state.store(kLocked, std::memory_order_relaxed);
         return;
      }
      // From here on the holder is told that someone waits; a wrong guess costs one wake.
      while (_state.exchange(kContended, std::memory_order_acquire) != kFree) {
         _state.wait(kContended, std::memory_order_relaxed);
      }
   }
   bool try_lock() {
      uint32_t state = kFree;
      return _state.compare_exchange_strong(state, kLocked, std::memory_order_acquire,
                                            std::memory_order_relaxed);
   }
   void unlock() {
      if (_state.exchange(kFree, std::memory_order_release) == kContended) _state.notify_one();
   }

private:
   static constexpr uint32_t kFree = 0, kLocked = 1, kContended = 2;
   std::atomic<uint32_t> _state{kFree};
};

// The log manager's mutex: owner-checked like the library's Mutex (with its panic texts),
// over a LogWriterMutex, so that a report child takes it over, as it does the writers'
// locks, when a thread that is not running there held it at fork time.
class LogManagerMutex final : public virtual System::Mutex, public ObjectImpl {
public:
   void Lock() PELMORA_ACQUIRE() PELMORA_NO_THREAD_SAFETY_ANALYSIS override {
      PELMORA_VERIFY(!_mutex.IsLocked());
      _mutex.Lock();
   }
   void Unlock() PELMORA_RELEASE() PELMORA_NO_THREAD_SAFETY_ANALYSIS override {
      PELMORA_VERIFY(_mutex.IsLocked());
      _mutex.Unlock();
   }
   bool IsLocked() const override { return _mutex.IsLocked(); }

private:
   // The lock word and the thread that holds it.
   class OwnedWord {
   public:
      void Lock() {
         _word.lock();
         _owner.store(pthread_self(), std::memory_order_relaxed);
      }
      void Unlock() {
         _owner.store(0, std::memory_order_relaxed);
         _word.unlock();
      }
      bool IsLocked() const { return _owner.load(std::memory_order_relaxed) == pthread_self(); }

   private:
      LogWriterMutex _word;
      std::atomic<pthread_t> _owner{0};
   };

   OwnedWord _mutex;
};

// A writer over a target Writer, filtered by a mask; its mutex serialises the target
// against flushing and reading from other threads.
class LogWriterImpl : public virtual LogWriter, public ObjectImpl {
public:
   // `memory`: the writer serves the memory half of combined levels.
   LogWriterImpl(Writer* target, Logger::CombinedLevel mask, bool memory);

   void Write(Logger::CombinedLevel level, const char* data, int length) override;
   void Flush() override;
   void Close() override;
   void Reopen() override {}
   Logger::CombinedLevel GetMask() const override { return _mask.load(std::memory_order_relaxed); }
   void SetMask(Logger::CombinedLevel mask) override { _mask.store(mask, std::memory_order_relaxed); }
   bool SetLevelByName(const std::string& name) override;
   Writer* GetTarget() const override { return _target.Get(); }
   bool IsMemoryWriter() const { return _memory; }
   // Bytes of whole lines of one level that a thread may keep for this writer before
   // handing them on together; 0 when every line must reach it at once, kAnyLineBatch
   // when it takes the batches its output's other writers ask for.
   virtual int GetLineBatchBytes() const { return 0; }
   static constexpr int kAnyLineBatch = -1;

protected:
   // With _mutex held.
   virtual void WriteLocked(Logger::CombinedLevel level, const char* data, int length);
   virtual void FlushLocked();
   virtual void CloseLocked();

   LogWriterMutex _mutex;

private:
   Ref<Writer> _target;
   std::atomic<Logger::CombinedLevel> _mask;
   const bool _memory;
};

// The in-memory ring: the most recent bytes of the lines at its memory levels.
class MemLogWriterImpl : public LogWriterImpl {
public:
   MemLogWriterImpl(int sizeBytes, Logger::CombinedLevel mask);
   // The whole lines the ring holds, oldest first.
   std::string GetText();
   // As GetText for a dying process: waits for the lock until `deadline`, then reads
   // without it (in a report child, the thread that held it no longer runs).
   std::string GetTextForReport(std::chrono::steady_clock::time_point deadline);

   // Lines reach it in their threads' batches; reading it hands every batch on first.
   int GetLineBatchBytes() const override { return kAnyLineBatch; }

protected:
   void WriteLocked(Logger::CombinedLevel level, const char* data, int length) override;

private:
   std::string GetTextLocked();
};

// The per-thread recursive write lock, with readers (who may re-enter while a writer
// waits) sharing it. A thread that holds the read lock must not ask for the write lock.
// One word and the futex behind std::atomic::wait: taking and giving back an uncontended
// hold is one atomic operation each, which matters on every log line.
class LogOutputLock {
public:
   void ReadLock();
   // False when a writer holds the lock.
   bool TryReadLock();
   // Inline where it costs one compare-and-swap: every line takes it.
   void WriteLock() {
      const void* self = Self();
      if (_owner.load(std::memory_order_relaxed) == self) {
         ++_depth;
         return;
      }
      uint32_t state = 0;
      if (!_state.compare_exchange_strong(state, kWriter, std::memory_order_acquire,
                                          std::memory_order_relaxed)) {
         return WriteLockContended(self);
      }
      _owner.store(self, std::memory_order_relaxed);
      _depth = 1;
   }
   void ReadUnlock();
   // WriteLock when it needs no wait: false when another thread holds the lock or this
   // one holds it for reading. A report child takes a held lock over, as WriteLock does.
   bool TryWriteLock();
   void WriteUnlock() {
      PELMORA_VERIFY(IsWriteLockedByMe());
      if (--_depth > 0) return;
      _owner.store(nullptr, std::memory_order_relaxed);
      if (_state.exchange(0, std::memory_order_release) & kWaiting) _state.notify_all();
   }
   bool IsWriteLockedByMe() const { return _owner.load(std::memory_order_relaxed) == Self(); }

private:
   static constexpr uint32_t kWriter = 1u << 31;
   static constexpr uint32_t kWaiting = 1u << 30;  // someone sleeps on _state
   static constexpr uint32_t kReaders = kWaiting - 1;

   // The address of a thread-local object names the thread without a system call;
   // initial-exec makes it one load instead of a call.
   static const void* Self() {
      [[gnu::tls_model("initial-exec")]] static thread_local char marker;
      return &marker;
   }
   // WriteLock when the lock was not free at first sight.
   void WriteLockContended(const void* self);
   // Sleeps until _state differs from `seen`, after marking that someone waits; returns
   // the state found then.
   uint32_t Await(uint32_t seen);

   std::atomic<uint32_t> _state{0};
   std::atomic<const void*> _owner{nullptr};
   int _depth = 0;  // of the owner's write (and nested read) holds
};

// Whole lines of one level that one thread wrote to one output and has not handed on yet.
// The thread appends under `mutex` alone; handing the lines to the writers takes the
// output's write lock first, then `mutex`.
class LogLineBatch final : public ObjectImpl {
public:
   explicit LogLineBatch(int capacity) : capacity(capacity), data(new char[capacity]) {}
   ~LogLineBatch() override { delete[] data; }

   LogWriterMutex mutex;
   const int capacity;
   char* const data;
   int size = 0;
   Logger::CombinedLevel level = 0;
   bool orphaned = false;  // its thread has ended: dropped once handed on
   bool detached = false;  // its output is gone: the thread makes a new one
};

class LogOutputImpl;

// The calling thread's batches, one per output it wrote whole lines to. Only its thread
// uses it; its end orphans the batches, whose lines their outputs hand on later.
class LogThreadBatches {
public:
   LogThreadBatches() = default;
   LogThreadBatches(const LogThreadBatches&) = delete;
   LogThreadBatches& operator=(const LogThreadBatches&) = delete;
   ~LogThreadBatches();

   // This thread's batch for `output`, or null.
   LogLineBatch* Find(const LogOutputImpl* output) const;
   // As Find, making and registering the batch when there is none. Inline for the usual
   // case, the output of the thread's last line.
   LogLineBatch* Get(LogOutputImpl* output, int capacity);
   // Before a line to `next`: hands on the lines this thread keeps for another output, so
   // that a writer the two outputs share gets the thread's lines in order. At most one
   // of the thread's batches holds lines at any time.
   void HandOnOthers(const LogOutputImpl* next) {
      if (_keptFor != nullptr && _keptFor != next) HandOnKept();
   }
   // A line was kept for `output`.
   void NoteKept(const LogOutputImpl* output) { _keptFor = output; }

private:
   LogLineBatch* GetOther(LogOutputImpl* output, int capacity);
   LogLineBatch* Make(LogOutputImpl* output, int capacity);
   void HandOnKept();

   struct Entry {
      const LogOutputImpl* output;
      uint64_t id;
      Ref<LogLineBatch> batch;
   };
   std::vector<Entry> _entries;
   // The output whose batch may hold lines, or null.
   const LogOutputImpl* _keptFor = nullptr;
   // The entry found last.
   const LogOutputImpl* _lastOutput = nullptr;
   uint64_t _lastId = 0;
   LogLineBatch* _last = nullptr;
};

// Hands every thread's batched lines to their writers, in every output that has batches.
void DrainLineBatches();

// The system calls a file log writer goes through. Tests replace one to make a step fail
// or to count it; everything else uses the defaults.
struct LogFileOps {
   int (*open)(const char* path, int flags, mode_t mode);
   ssize_t (*write)(int fd, const void* data, size_t length);
   int (*rename)(const char* from, const char* to);
   static const LogFileOps& Posix();
};
void CreateFileLogWriter(const std::string& name, const LogFileOptions& options,
                         const LogFileOps& ops, Ref<FileLogWriter>& out);

class LogOutputImpl final : public virtual LogOutput, public ObjectImpl {
public:
   explicit LogOutputImpl(const std::string& name);
   ~LogOutputImpl() override;

   const std::string& GetName() const override { return _name; }
   void AddWriter(const std::string& name, LogWriter* writer) override;
   void RemoveWriter(const std::string& name, Ref<LogWriter>& out) override;
   void GetWriter(const std::string& name, Ref<LogWriter>& out) override;
   void Write(Logger::CombinedLevel level, const char* data, int length) override;
   void WriteMessage(Logger::CombinedLevel level, const char* data, int length) override;
   void Flush() override;
   void Reopen() override;
   void Close() override;
   void RecursiveReadLock() override { _lock.ReadLock(); }
   void RecursiveWriteLock() override { _lock.WriteLock(); }
   void ReadUnlock() override { _lock.ReadUnlock(); }
   void WriteUnlock() override { _lock.WriteUnlock(); }

   // One whole line from the calling thread, whose batches are `mine`: kept in the
   // thread's batch while every writer takes batches and the line is not severe; written
   // at once otherwise, after the thread's earlier lines.
   void WriteLine(LogThreadBatches& mine, Logger::CombinedLevel level, const char* data,
                  int length);
   // With the write lock held, before a line at `level` goes to the writers unbatched:
   // hands on the thread's batch, so that its lines stay in order, and for a severe line
   // every thread's, for a report that may end the process.
   void HandOnBefore(LogThreadBatches& mine, Logger::CombinedLevel level);
   // Hands every thread's batched lines to the writers, unless that needs a wait for the
   // output's lock (another thread is in a line of several pieces, or this one reads the
   // writers): then the next drain does it. Never waiting keeps flushes, ring reads and
   // exit free of lock-order deadlocks between outputs.
   void DrainBatches();
   // As DrainBatches for `batch` alone, waiting for the lock up to `patience`.
   void HandOnWithin(LogLineBatch* batch, std::chrono::milliseconds patience);
   uint64_t GetId() const { return _id; }

   // The writers at this moment, copied under the read lock.
   RefVector<LogWriter> Snapshot();
   // As Snapshot, trying for the read lock until `deadline`; false if it never came.
   bool TrySnapshot(std::chrono::steady_clock::time_point deadline, RefVector<LogWriter>& out);

private:
   // With the write lock held: makes _order follow _writers again.
   void Reorder();
   // With the write lock held: writes the batch's lines to the writers and empties it.
   void HandOn(LogLineBatch* batch);
   // With the write lock held: HandOn for every batch, forgetting orphaned ones.
   void HandOnAll();
   friend class LogThreadBatches;
   friend void DrainLineBatches();
   void AddBatch(const Ref<LogLineBatch>& batch);

   const std::string _name;
   // On a cache line of its own: every line writes it, from whichever thread logs, and
   // what the line only reads (the writers, this object's table) then stays shared.
   alignas(64) LogOutputLock _lock;
   alignas(64) RefMap<std::string, LogWriter> _writers;
   // The writers of _writers in its order, which every line walks: a vector walk costs
   // less than the map's, and the map keeps them alive.
   std::vector<LogWriter*> _order;
   // Names this output among all made, for a thread's batches; its address may be reused.
   const uint64_t _id;
   // The batch size every writer takes, 0 when one does not; changed under the write lock.
   std::atomic<int> _batchBytes{0};
   // Every thread's batch for this output, under the write lock.
   RefVector<LogLineBatch> _batches;
   std::atomic<bool> _hasBatches{false};
   // DrainLineBatches calls under way on this output; its destructor waits for none.
   std::atomic<int> _drainers{0};
};

inline LogLineBatch* LogThreadBatches::Get(LogOutputImpl* output, int capacity) {
   if (output == _lastOutput && output->GetId() == _lastId) return _last;
   return GetOther(output, capacity);
}

class LoggerImpl : public virtual Logger, public ObjectImpl {
public:
   LoggerImpl(const std::string& name, CombinedLevel mask, LoggerImpl* parent,
              LogManagerImpl* manager, LogOutput* output);
   ~LoggerImpl() override;

   void Write(const char* data, int length) override;
   void Write(const char* text) override;
   void Write(const std::string& text) override;
   void WriteInt(const char* format, int value) override;
   void Close() override {}
   void Begin(LogLevel level) override;
   void End() override;
   Writer* GetLineWriter() override;
   void CreateLogger(const std::string& name, Ref<Logger>& out) override;
   void CreateLogger(const std::string& name, CombinedLevel mask, Ref<Logger>& out) override;
   const std::string& GetSubsystemName() const override { return _name; }
   LogOutput* GetLogOutput() const override { return _output.Get(); }
   LogManager* GetLogManager() const override;
   Logger* GetParent() const override { return _parent.Get(); }
   bool SetLevelByName(const std::string& name) override;
   bool SetMemLevelByName(const std::string& name) override;
   std::string GetLevelByName() const override;
   std::string GetMemLevelByName() const override;

   // Begin with the combined level given as is (not masked by the logger's).
   void BeginCombined(CombinedLevel level);
   void SetLogHalf(CombinedLevel mask16);
   void SetMemHalf(CombinedLevel mask16);

private:
   const std::string _name;
   Ref<LoggerImpl> _parent;
   Ref<LogManagerImpl> _manager;
   Ref<LogOutput> _output;
   // _output as this library's output, which can batch a thread's lines; null for another.
   LogOutputImpl* const _outputImpl;
};

class LogManagerImpl : public virtual LogManager, public System::LockableObjectImpl {
public:
   LogManagerImpl();

   bool SetLogLevel(const std::string& subsystem, const std::string& level) override;
   bool SetMemLevel(const std::string& subsystem, const std::string& level) override;
   bool SetLevel(const std::string& subsystem, const std::string& logLevel,
                 const std::string& memLevel) override;
   bool SetDefaultLevels(const std::string& logLevel, const std::string& memLevel) override;
   void GetLoggers(std::map<std::string, std::string>& out) override;
   void GetMemLoggers(std::map<std::string, std::string>& out) override;
   Logger::CombinedLevel FindLogLevelForName(const std::string& subsystem) override;
   Logger::CombinedLevel FindMemLevelForName(const std::string& subsystem) override;
   void GetOrCreateLogOutput(const std::string& name, Ref<LogOutput>& out) override;
   void FindLogOutput(const std::string& name, Ref<LogOutput>& out) override;
   void RemoveLogOutput(const std::string& name, Ref<LogOutput>& out) override;
   void Reopen() override;
   void Flush() override;

   void RegisterLogger(LoggerImpl* logger);
   void UnregisterLogger(LoggerImpl* logger);
   // Whether the manager keeps a level for `subsystem`.
   bool HasOwnLevels(const std::string& subsystem);
   void LoadLogLevels(Config* config) override;
   // As SetLogLevel and SetMemLevel, for every subsystem whose name begins with `prefix`
   // and has no level of its own; the longest matching prefix wins.
   bool SetLogLevelForPrefix(const std::string& prefix, const std::string& level) override;
   bool SetMemLevelForPrefix(const std::string& prefix, const std::string& level) override;

private:
   // Locks unless the calling thread holds the lock already (the panic path does).
   class Guard;
   RefVector<LogOutput> Outputs();

   std::set<LoggerImpl*> _loggers;
   std::map<std::string, Logger::CombinedLevel> _logLevels;  // 16-bit masks
   std::map<std::string, Logger::CombinedLevel> _memLevels;
   std::map<std::string, Logger::CombinedLevel> _logPrefixes;
   std::map<std::string, Logger::CombinedLevel> _memPrefixes;
   Logger::CombinedLevel _defaultLog;
   Logger::CombinedLevel _defaultMem;
   RefMap<std::string, LogOutput> _outputs;
};

}  // namespace Pelmora::Service
