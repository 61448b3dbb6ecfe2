#pragma once
// An RWLock lets many readers or one writer in. Each thread's holds are kept per thread,
// so a reader may read-lock again without waiting behind a writer, and the Is...Locked
// queries answer for the calling thread without locking. A reader may upgrade to the write
// lock and a writer downgrade to a read hold. RWLockableObjectImpl is the base of objects
// that are themselves reader/writer lockable; it owns one RWLock. Thread-safe.

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/object/threadAnnotations.h"

namespace Pelmora::System {

class PELMORA_EXPORT PELMORA_CAPABILITY("rwlock") RWLockableObject : public virtual Object {
public:
   enum LockMode {
      // Readers enter while no writer holds the lock; writers may starve.
      LOCK_MODE_DEFAULT = 0,
      // A waiting writer (or upgrader) holds back new readers.
      LOCK_MODE_WRITER_PRIORITY = 1,
      // Accepted from older callers; behaves as LOCK_MODE_WRITER_PRIORITY.
      LOCK_MODE_WRITER_PRIORITY_LEGACY = 2,
   };

   virtual void ReadLock() PELMORA_ACQUIRE_SHARED() = 0;
   // The calling thread must hold no read or write lock on it.
   virtual void WriteLock() PELMORA_ACQUIRE() = 0;
   // Releases one read hold or the write lock of the calling thread.
   virtual void Unlock() PELMORA_RELEASE_GENERIC() = 0;
   // With exactly one read hold: waits until the caller is the only reader and returns
   // with the write lock. False at once when another upgrade is pending; the read hold
   // is then kept (waiting would deadlock both).
   virtual bool UpgradeReadLock() = 0;
   // Turns the caller's write lock into one read hold.
   virtual void DowngradeWriteLock() = 0;
   // These three describe the calling thread's holds.
   virtual bool IsReadLocked() const = 0;
   virtual bool IsWriteLocked() const = 0;
   virtual bool IsUnlocked() const = 0;
};

class PELMORA_EXPORT RWLock : public virtual RWLockableObject {};

class PELMORA_EXPORT RWLockableObjectImpl : public virtual RWLockableObject, public ObjectImpl {
public:
   // With a new lock of `mode` from the system factory.
   explicit RWLockableObjectImpl(int mode = LOCK_MODE_DEFAULT);
   // Shares `lock`.
   explicit RWLockableObjectImpl(RWLock* lock);

   void ReadLock() PELMORA_ACQUIRE_SHARED() override;
   void WriteLock() PELMORA_ACQUIRE() override;
   void Unlock() PELMORA_RELEASE_GENERIC() override;
   bool UpgradeReadLock() override;
   void DowngradeWriteLock() override;
   bool IsReadLocked() const override;
   bool IsWriteLocked() const override;
   bool IsUnlocked() const override;

   RWLock* GetRWLock() const { return _lock.Get(); }

private:
   Ref<RWLock> _lock;
};

}  // namespace Pelmora::System
