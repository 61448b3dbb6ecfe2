// Per-thread batches of whole lines: while every writer of an output takes them (buffered
// file writers, which set their size, and the memory ring), a thread keeps its lines and
// hands them on a batch at a time, so that threads logging at once do not pass the
// output's and the writers' locks between them on every line. A batch is handed on when
// it is full, before a line of another level, to another output or of several pieces,
// with every severe line (all threads' batches then), before the output's writers change
// or it closes, and by drains: the output's Flush and Reopen, a file writer's Flush, a
// read of the ring and every half flush interval from the file writers' flushing thread.
// A drain never waits for an output's lock (it may be called with another output's lock
// held, or at exit while a thread is stuck in a line); a busy output waits for the next.
// Lines of different threads may therefore reach a writer out of their time order, by
// at most one batch each; a thread's own lines not.

#include <algorithm>
#include <chrono>
#include <cstring>
#include <thread>
#include <vector>

#include "src/log/logImpl.h"

namespace Pelmora::Service {

namespace {

// The outputs that have had batches. Lives until exit, like the outputs that may be
// drained then; its lock is one a report child may take over.
struct BatchRegistry {
   LogWriterMutex mutex;
   std::vector<LogOutputImpl*> outputs;
};

BatchRegistry& Registry() {
   static BatchRegistry* const registry = new BatchRegistry();
   return *registry;
}

std::atomic<uint64_t> g_nextOutputId{1};

// How long a thread that turns to another output waits to hand on its lines for the
// last one, when another thread is in the middle of a line there.
constexpr std::chrono::milliseconds kHandOnPatience{100};

}  // namespace

// ---- the thread's side

LogThreadBatches::~LogThreadBatches() {
   for (Entry& entry : _entries) {
      std::lock_guard<LogWriterMutex> lock(entry.batch->mutex);
      entry.batch->orphaned = true;
   }
}

LogLineBatch* LogThreadBatches::Find(const LogOutputImpl* output) const {
   // An entry whose output has gone may name a new output at the same address: the id
   // tells them apart.
   for (const Entry& entry : _entries) {
      if (entry.output == output && entry.id == output->GetId()) return entry.batch.Get();
   }
   return nullptr;
}

LogLineBatch* LogThreadBatches::GetOther(LogOutputImpl* output, int capacity) {
   LogLineBatch* batch = Find(output);
   if (batch == nullptr) batch = Make(output, capacity);
   _lastOutput = output;
   _lastId = output->GetId();
   _last = batch;
   return batch;
}

LogLineBatch* LogThreadBatches::Make(LogOutputImpl* output, int capacity) {
   // Entries of outputs that have gone are dropped here, the only time the list grows.
   std::erase_if(_entries, [](Entry& entry) {
      std::lock_guard<LogWriterMutex> lock(entry.batch->mutex);
      return entry.batch->detached;
   });
   Ref<LogLineBatch> batch = new LogLineBatch(capacity);
   _entries.push_back(Entry{output, output->GetId(), batch});
   try {
      output->AddBatch(batch);
   } catch (...) {
      _entries.pop_back();
      throw;
   }
   return batch.Get();
}

void LogThreadBatches::HandOnKept() {
   const LogOutputImpl* output = _keptFor;
   _keptFor = nullptr;
   LogLineBatch* batch = nullptr;
   uint64_t id = 0;
   for (const Entry& entry : _entries) {
      if (entry.output == output) {
         batch = entry.batch.Get();
         id = entry.id;
      }
   }
   if (batch == nullptr) return;
   // The output may be gone or going: only one still in the registry, counted among its
   // drainers, is used, as DrainLineBatches does.
   LogOutputImpl* live = nullptr;
   {
      BatchRegistry& registry = Registry();
      std::lock_guard<LogWriterMutex> lock(registry.mutex);
      for (LogOutputImpl* candidate : registry.outputs) {
         if (candidate == output && candidate->GetId() == id) {
            live = candidate;
            live->_drainers.fetch_add(1, std::memory_order_acq_rel);
         }
      }
   }
   if (live == nullptr) return;  // its end wrote the batch out
   // A bounded wait: this thread may hold another output's lock (a line logged while a
   // longer one is being written), whose holder order it must not wait on for ever.
   live->HandOnWithin(batch, kHandOnPatience);
   live->_drainers.fetch_sub(1, std::memory_order_acq_rel);
}

// ---- the output's side

LogOutputImpl::LogOutputImpl(const std::string& name)
   : _name(name), _id(g_nextOutputId.fetch_add(1, std::memory_order_relaxed)) {}

LogOutputImpl::~LogOutputImpl() {
   if (!_hasBatches.load(std::memory_order_acquire)) return;
   {
      BatchRegistry& registry = Registry();
      std::lock_guard<LogWriterMutex> lock(registry.mutex);
      std::erase(registry.outputs, this);
   }
   // A drain that found this output before it left the registry finishes first.
   while (_drainers.load(std::memory_order_acquire) > 0) std::this_thread::yield();
   _lock.WriteLock();
   for (Ref<LogLineBatch>& batch : _batches) {
      std::lock_guard<LogWriterMutex> lock(batch->mutex);
      HandOn(batch.Get());
      batch->detached = true;
   }
   _batches.clear();
   _lock.WriteUnlock();
}

void LogOutputImpl::AddBatch(const Ref<LogLineBatch>& batch) {
   _lock.WriteLock();
   try {
      _batches.push_back(batch);
   } catch (...) {
      _lock.WriteUnlock();
      throw;
   }
   bool first = !_hasBatches.exchange(true, std::memory_order_acq_rel);
   _lock.WriteUnlock();
   if (first) {
      BatchRegistry& registry = Registry();
      std::lock_guard<LogWriterMutex> lock(registry.mutex);
      registry.outputs.push_back(this);
   }
}

void LogOutputImpl::HandOn(LogLineBatch* batch) {
   if (batch->size == 0) return;
   int size = batch->size;
   batch->size = 0;
   Write(batch->level, batch->data, size);
}

void LogOutputImpl::HandOnAll() {
   if (!_hasBatches.load(std::memory_order_relaxed)) return;
   std::erase_if(_batches, [this](Ref<LogLineBatch>& batch) {
      std::lock_guard<LogWriterMutex> lock(batch->mutex);
      HandOn(batch.Get());
      return batch->orphaned;
   });
}

void LogOutputImpl::HandOnBefore(LogThreadBatches& mine, Logger::CombinedLevel level) {
   if (!_hasBatches.load(std::memory_order_relaxed)) return;
   if ((level & kSevereLevels) != 0) return HandOnAll();
   if (LogLineBatch* batch = mine.Find(this)) {
      std::lock_guard<LogWriterMutex> lock(batch->mutex);
      HandOn(batch);
   }
}

void LogOutputImpl::DrainBatches() {
   if (!_hasBatches.load(std::memory_order_acquire) || !_lock.TryWriteLock()) return;
   HandOnAll();
   _lock.WriteUnlock();
}

void LogOutputImpl::HandOnWithin(LogLineBatch* batch, std::chrono::milliseconds patience) {
   auto deadline = std::chrono::steady_clock::now() + patience;
   while (!_lock.TryWriteLock()) {
      // Given up: the lines go with the next drain, after this thread's next ones.
      if (std::chrono::steady_clock::now() >= deadline) return;
      std::this_thread::yield();
   }
   {
      std::lock_guard<LogWriterMutex> lock(batch->mutex);
      HandOn(batch);
   }
   _lock.WriteUnlock();
}

void LogOutputImpl::WriteLine(LogThreadBatches& mine, Logger::CombinedLevel level,
                              const char* data, int length) {
   mine.HandOnOthers(this);
   int bytes = _batchBytes.load(std::memory_order_relaxed);
   if (bytes > 0 && length <= bytes && (level & kSevereLevels) == 0) {
      LogLineBatch* batch = nullptr;
      try {
         batch = mine.Get(this, bytes);
      } catch (...) {
         // Without a batch the line goes the unbatched way.
      }
      if (batch) {
         batch->mutex.lock();
         // Read again under the batch's lock, which Close takes after setting it to 0:
         // a line kept here is handed on there. The size may have shrunk since the batch
         // was made (a writer with a smaller one joined).
         int room = std::min(batch->capacity, _batchBytes.load(std::memory_order_relaxed));
         bool batching = room > 0 && length <= room;
         if (batching &&
             (batch->size == 0 || (batch->level == level && batch->size + length <= room))) {
            memcpy(batch->data + batch->size, data, static_cast<size_t>(length));
            batch->size += length;
            batch->level = level;
            batch->mutex.unlock();
            mine.NoteKept(this);
            return;
         }
         batch->mutex.unlock();
         // Full, or of another level: hand it on, then keep the line.
         _lock.WriteLock();
         batch->mutex.lock();
         HandOn(batch);
         room = std::min(batch->capacity, _batchBytes.load(std::memory_order_relaxed));
         batching = room > 0 && length <= room;
         if (batching) {
            memcpy(batch->data, data, static_cast<size_t>(length));
            batch->size = length;
            batch->level = level;
         }
         batch->mutex.unlock();
         if (batching) mine.NoteKept(this);
         if (!batching) Write(level, data, length);
         _lock.WriteUnlock();
         return;
      }
   }
   _lock.WriteLock();
   HandOnBefore(mine, level);
   Write(level, data, length);
   _lock.WriteUnlock();
}

void DrainLineBatches() {
   std::vector<LogOutputImpl*> outputs;
   BatchRegistry& registry = Registry();
   {
      std::lock_guard<LogWriterMutex> lock(registry.mutex);
      outputs = registry.outputs;
      for (LogOutputImpl* output : outputs) output->_drainers.fetch_add(1, std::memory_order_acq_rel);
   }
   for (LogOutputImpl* output : outputs) {
      output->DrainBatches();
      output->_drainers.fetch_sub(1, std::memory_order_acq_rel);
   }
}

}  // namespace Pelmora::Service
