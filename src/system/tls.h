#pragma once
// TLS keys and the per-thread slots they index. A key is a slot index (low 17 bits) and
// a version (upper 15 bits, never 0). A released index is reused with a new version, and
// a slot remembers the version it was stored under, so an object left behind by a
// released key is recognised instead of being handed to the key's next owner.
// TlsKeyTable is thread-safe; a TlsObjects belongs to its thread.

#include <cstdint>
#include <vector>

#include "pelmora/object/atomic.h"
#include "pelmora/object/ref.h"
#include "src/internal/nativeMutex.h"

namespace Pelmora::System {

using TlsKey = uint32_t;

class TlsKeyTable {
public:
   static constexpr uint32_t INDEX_BITS = 17;
   static constexpr uint32_t INVALID_INDEX = 0x1FFFF;
   static constexpr uint32_t MAX_INDEX = 0x1FFFE;
   static constexpr uint32_t VERSION_MASK = 0x7FFF;

   static uint32_t GetIndex(TlsKey key) { return key & INVALID_INDEX; }
   static uint32_t GetVersion(TlsKey key) { return key >> INDEX_BITS; }
   static bool IsKey(TlsKey key) { return GetVersion(key) != 0; }
   static TlsKey MakeKey(uint32_t version, uint32_t index);

   TlsKey Reserve();
   void Release(TlsKey key);

   // The process's table, created on first use and never destroyed.
   static TlsKeyTable& GetInstance();

private:
   NativeMutex _mutex;
   // Head of the free list; a free slot of _keys holds the next free index.
   uint32_t _firstFreeIndex PELMORA_GUARDED_BY(_mutex) = INVALID_INDEX;
   std::vector<uint32_t> _keys PELMORA_GUARDED_BY(_mutex);
   uint32_t _version PELMORA_GUARDED_BY(_mutex) = 0;
};

class TlsObjects {
public:
   TlsObjects() = default;
   TlsObjects(const TlsObjects&) = delete;
   TlsObjects& operator=(const TlsObjects&) = delete;

   Object* Get(TlsKey key) const;
   void Set(TlsKey key, Object* object);
   // Releases every object; objects that store others while being released are released too.
   void Clear();

private:
   struct Slot {
      Ref<Object> object;
      uint32_t version = 0;  // 0: empty
   };
   std::vector<Slot> _slots;
};

// A key reserved on first use, once per process: concurrent first users agree on one key.
class LazyTlsKey {
public:
   constexpr LazyTlsKey() = default;
   TlsKey Get() {
      TlsKey key = _key.Read();
      return key != 0 ? key : Publish();
   }

private:
   TlsKey Publish();
   Atomic<TlsKey> _key{0};
};

}  // namespace Pelmora::System
