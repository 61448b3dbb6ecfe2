// The process's TLS key table and the per-thread slots.

#include "src/system/tls.h"

#include "pelmora/exception/panic.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/system/thread.h"
#include "src/internal/report.h"

namespace Pelmora::System {

TlsKey TlsKeyTable::MakeKey(uint32_t version, uint32_t index) {
   PELMORA_VERIFY(index <= MAX_INDEX);
   return ((version & VERSION_MASK) << INDEX_BITS) | index;
}

TlsKey TlsKeyTable::Reserve() {
   NativeSynchronized lock(_mutex);
   // Version 0 marks "no key" and empty slots.
   if ((++_version & VERSION_MASK) == 0) ++_version;
   uint32_t index;
   if (_firstFreeIndex == INVALID_INDEX) {
      PELMORA_VERIFY(_keys.size() < MAX_INDEX);
      index = static_cast<uint32_t>(_keys.size());
      _keys.push_back(0);
   } else {
      index = _firstFreeIndex;
      _firstFreeIndex = _keys[index];
      PELMORA_VERIFY(_firstFreeIndex == INVALID_INDEX || _firstFreeIndex < _keys.size());
   }
   TlsKey key = MakeKey(_version, index);
   _keys[index] = key;
   return key;
}

void TlsKeyTable::Release(TlsKey key) {
   NativeSynchronized lock(_mutex);
   uint32_t index = GetIndex(key);
   // A free slot holds an index, never a key, so releasing twice is caught here too.
   if (index >= _keys.size() || key != (TlsKey)_keys[index]) {
      PanicVerify("key == (TlsKey)_keys[index]", __FILE__, __LINE__);
   }
   _keys[index] = _firstFreeIndex;
   _firstFreeIndex = index;
}

TlsKeyTable& TlsKeyTable::GetInstance() {
   // Keys are released from thread-exit paths that may run during process exit.
   static TlsKeyTable* const table = new TlsKeyTable();
   return *table;
}

Object* TlsObjects::Get(TlsKey key) const {
   uint32_t index = TlsKeyTable::GetIndex(key);
   if (index >= _slots.size()) return nullptr;
   const Slot& slot = _slots[index];
   uint32_t version = TlsKeyTable::GetVersion(key);
   if (slot.version == 0 || slot.version == version) return slot.object.Get();
   Internal::GetReportSink().Log(
       Internal::kReportPanicLevel,
       MessageFormatter::ASPrint("Found unexpected TLS object at index %1. Expected version=%2, "
                                 "found version=%3, found object=%4",
                                 index, version, slot.version, slot.object));
   PELMORA_NOT_REACHED();
}

void TlsObjects::Set(TlsKey key, Object* object) {
   PELMORA_VERIFY(TlsKeyTable::IsKey(key));
   uint32_t index = TlsKeyTable::GetIndex(key);
   uint32_t version = TlsKeyTable::GetVersion(key);
   if (index >= _slots.size()) _slots.resize(index + 1);
   Slot& slot = _slots[index];
   if (slot.version != 0 && slot.version != version) {
      Internal::GetReportSink().Log(
          Internal::kReportErrorLevel,
          MessageFormatter::ASPrint("Found leaked TLS object at index %1. Expected version=%2, "
                                    "found version=%3, found object=%4",
                                    index, version, slot.version, slot.object));
   }
   // Released only after the slot is settled: its destructor may use TLS itself.
   Ref<Object> previous = std::move(slot.object);
   slot.object = object;
   slot.version = object ? version : 0;
}

void TlsObjects::Clear() {
   // Bounded like the system's own rounds of thread-exit destructors.
   for (int round = 0; round < 4 && !_slots.empty(); ++round) {
      std::vector<Slot> released;
      released.swap(_slots);
   }
}

TlsKey LazyTlsKey::Publish() {
   TlsKey mine = TlsKeyTable::GetInstance().Reserve();
   TlsKey expected = 0;
   if (_key.CompareAndSwap(expected, mine)) return mine;
   TlsKeyTable::GetInstance().Release(mine);
   return expected;
}

int ReserveTlsKey() {
   return static_cast<int>(TlsKeyTable::GetInstance().Reserve());
}

void ReleaseTlsKey(int key) {
   TlsKeyTable::GetInstance().Release(static_cast<TlsKey>(key));
}

}  // namespace Pelmora::System
