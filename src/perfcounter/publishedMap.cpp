// Published accumulators, the map that merges builders into them, and the per-thread
// builders with their scopes.

#include "pelmora/perfCounter/publishedMap.h"

#include <set>
#include <string_view>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/system/thread.h"
#include "src/perfcounter/perfLog.h"
#include "src/internal/nativeMutex.h"

namespace Pelmora::PerfCounter {

namespace {

// The accumulator under its mutex, and the publisher of it. Apart from the published
// accumulator so that the registry holding the publisher keeps no cycle alive.
class AccumulatorCore : public virtual GroupPublisher, public ObjectImpl {
public:
   explicit AccumulatorCore(LwAccumulator* accumulator) : accumulator(accumulator) {}

   void CollectValues(RefVector<Metadata>&, std::vector<Value>& values) override {
      System::NativeSynchronized lock(mutex);
      accumulator->ReadValues(values);
   }

   System::NativeMutex mutex;
   const Ref<LwAccumulator> accumulator;
};

class PublishedAccumulatorImpl : public virtual PublishedAccumulator, public ObjectImpl {
public:
   PublishedAccumulatorImpl(Registry* registry, std::string key, LwAccumulator* accumulator)
      : _registry(registry), _key(std::move(key)), _core(new AccumulatorCore(accumulator)) {}

   ~PublishedAccumulatorImpl() override {
      System::NativeSynchronized lock(_publishMutex);
      if (_item) _item->Unregister();
   }

   const std::string& GetKey() const { return _key; }
   const std::string& GetName() const override { return _core->accumulator->GetName(); }
   LwAccumulator::Type GetType() const override { return _core->accumulator->GetType(); }

   void Sample(long long value) override {
      System::NativeSynchronized lock(_core->mutex);
      _core->accumulator->Sample(value);
   }

   void Merge(LwAccumulator* source) override {
      System::NativeSynchronized lock(_core->mutex);
      _core->accumulator->Merge(source);
   }

   void GetValues(NamedValues& out) override {
      System::NativeSynchronized lock(_core->mutex);
      _core->accumulator->GetValues(out);
   }

   void Publish() override {
      System::NativeSynchronized lock(_publishMutex);
      if (_item || !_registry) throw InvalidStateException();
      NamedValues named;
      GetValues(named);
      RefVector<Metadata> metadata;
      for (auto& [m, value] : named) metadata.push_back(m);
      _registry->RegisterGroup(metadata, _core.Get(), _item);
   }

   void Unpublish() override {
      System::NativeSynchronized lock(_publishMutex);
      if (!_item) throw InvalidStateException();
      _item->Unregister();
      _item.Reset();
   }

   bool IsPublished() const override {
      System::NativeSynchronized lock(_publishMutex);
      return static_cast<bool>(_item);
   }

   // Unpublish for callers that may race another unpublishing: whoever comes second
   // finds nothing to do.
   void UnpublishIfPublished() {
      System::NativeSynchronized lock(_publishMutex);
      if (!_item) return;
      _item->Unregister();
      _item.Reset();
   }

private:
   Registry* const _registry;
   const std::string _key;
   const Ref<AccumulatorCore> _core;
   mutable System::NativeMutex _publishMutex;  // taken before the registry's lock
   Ref<RegistryItem> _item PELMORA_GUARDED_BY(_publishMutex);
};

// Orders published accumulators by key and finds them by a key alone.
struct ByKey {
   using is_transparent = void;
   bool operator()(const Ref<PublishedAccumulatorImpl>& a,
                   const Ref<PublishedAccumulatorImpl>& b) const {
      return a->GetKey() < b->GetKey();
   }
   bool operator()(const Ref<PublishedAccumulatorImpl>& a, std::string_view b) const {
      return a->GetKey() < b;
   }
   bool operator()(std::string_view a, const Ref<PublishedAccumulatorImpl>& b) const {
      return a < b->GetKey();
   }
};

class PublishedAccumulatorMapImpl : public virtual PublishedAccumulatorMap, public ObjectImpl {
public:
   explicit PublishedAccumulatorMapImpl(Registry* registry) : _registry(registry) {}

   ~PublishedAccumulatorMapImpl() override { Clear(); }

   // New keys are entered and merged under the map's mutex but published after it is
   // released: publishing waits for the registry's write lock, which a long scrape holds
   // back, and every thread leaving a statistics scope would wait with it.
   void Merge(LwStatsBuilder& builder) override {
      std::vector<std::pair<Ref<LwAccumulator>, std::string>> entries;
      builder.GetEntries(entries);
      std::vector<Ref<PublishedAccumulatorImpl>> created;
      std::vector<std::string> clashes;
      bool limitReached = false;
      int limit;
      {
         System::NativeSynchronized lock(_mutex);
         limit = _keyLimit;
         for (auto& [accumulator, key] : entries) {
            auto itr = _accumulators.find(key);
            if (itr == _accumulators.end()) {
               if (static_cast<int>(_accumulators.size()) >= _keyLimit) {
                  ++_refusedCount;
                  limitReached = limitReached || !_limitLogged;
                  _limitLogged = true;
                  continue;
               }
               _limitLogged = false;
               created.push_back(Create(key, accumulator.Get()));
               itr = _accumulators.insert(created.back()).first;
            } else if ((*itr)->GetType() != accumulator->GetType()) {
               // Two builders disagree on what the key counts: neither may end the process.
               ++_refusedCount;
               clashes.push_back(key);
               continue;
            }
            try {
               (*itr)->Merge(accumulator.Get());
            } catch (const std::exception& e) {
               Internal::LogText(Internal::kLogError,
                                 MessageFormatter::ASPrint("While merging %1: %2", key, e.what()));
            }
         }
      }
      for (const std::string& key : clashes) {
         Internal::LogText(Internal::kLogError,
                           MessageFormatter::ASPrint(
                               "Refused to merge %1: published as another kind of accumulator", key));
      }
      if (limitReached) {
         Internal::LogText(Internal::kLogWarning,
                           MessageFormatter::ASPrint(
                               "Published statistics reached their limit of %1 keys; new keys are refused",
                               limit));
      }
      for (const Ref<PublishedAccumulatorImpl>& accumulator : created) {
         try {
            Publish(accumulator);
         } catch (const std::exception& e) {
            Internal::LogText(Internal::kLogError,
                              MessageFormatter::ASPrint("While publishing ctr %1: %2",
                                                        accumulator->GetKey(), e.what()));
         }
      }
   }

   void Add(const std::string& key, LwAccumulator* accumulator) override {
      if (!accumulator) throw InvalidArgumentException();
      if (!ValidateStatsScope(key)) throw InvalidArgumentException(key);
      Ref<PublishedAccumulatorImpl> created;
      {
         System::NativeSynchronized lock(_mutex);
         if (_accumulators.find(key) != _accumulators.end()) throw AlreadyExistsException(key);
         if (static_cast<int>(_accumulators.size()) >= _keyLimit) {
            throw FullException(MessageFormatter::ASPrint(
                "Published statistics are at their limit of %1 keys", _keyLimit));
         }
         created = Create(key, accumulator);
         created->Merge(accumulator);
         _accumulators.insert(created);
      }
      Publish(created);
   }

   void SetKeyLimit(int limit) override {
      if (limit < 0) throw InvalidArgumentException(std::to_string(limit));
      System::NativeSynchronized lock(_mutex);
      _keyLimit = limit;
   }

   int GetKeyLimit() override {
      System::NativeSynchronized lock(_mutex);
      return _keyLimit;
   }

   long long GetRefusedCount() override {
      System::NativeSynchronized lock(_mutex);
      return _refusedCount;
   }

   bool Find(const std::string& key, Ref<PublishedAccumulator>& out) override {
      System::NativeSynchronized lock(_mutex);
      auto itr = _accumulators.find(key);
      if (itr == _accumulators.end()) return false;
      out = *itr;
      return true;
   }

   bool Remove(const std::string& key) override {
      System::NativeSynchronized lock(_mutex);
      auto itr = _accumulators.find(key);
      if (itr == _accumulators.end()) return false;
      Unpublish(*itr);
      _accumulators.erase(itr);
      return true;
   }

   void Clear() override {
      System::NativeSynchronized lock(_mutex);
      for (const Ref<PublishedAccumulatorImpl>& accumulator : _accumulators) Unpublish(accumulator);
      _accumulators.clear();
   }

   int GetSize() override {
      System::NativeSynchronized lock(_mutex);
      return static_cast<int>(_accumulators.size());
   }

private:
   // An empty accumulator of the kind of `sample`, to be published as "/" + key.
   Ref<PublishedAccumulatorImpl> Create(const std::string& key, LwAccumulator* sample) {
      PELMORA_VERIFY(!key.empty());
      Ref<LwAccumulator> accumulator;
      sample->CreateEmpty("/" + key, accumulator);
      return new PublishedAccumulatorImpl(_registry, key, accumulator.Get());
   }

   // Publishes an accumulator entered in the map; the caller holds none of the map's locks.
   // A refused one leaves the map again; one removed from the map meanwhile leaves the
   // registry again.
   void Publish(const Ref<PublishedAccumulatorImpl>& accumulator) {
      try {
         accumulator->Publish();
      } catch (...) {
         Forget(accumulator);
         throw;
      }
      bool kept;
      {
         System::NativeSynchronized lock(_mutex);
         auto itr = _accumulators.find(accumulator->GetKey());
         kept = itr != _accumulators.end() && *itr == accumulator;
      }
      if (!kept) accumulator->UnpublishIfPublished();
   }

   // Takes the accumulator out of the map unless the key has moved on to another one.
   void Forget(const Ref<PublishedAccumulatorImpl>& accumulator) {
      System::NativeSynchronized lock(_mutex);
      auto itr = _accumulators.find(accumulator->GetKey());
      if (itr != _accumulators.end() && *itr == accumulator) _accumulators.erase(itr);
   }

   // Someone may still hold the accumulator; it leaves the registry now all the same.
   static void Unpublish(const Ref<PublishedAccumulatorImpl>& accumulator) {
      try {
         if (accumulator->IsPublished()) accumulator->Unpublish();
      } catch (const std::exception& e) {
         Internal::LogText(Internal::kLogError,
                           MessageFormatter::ASPrint("While un-publishing ctr %1: %2",
                                                     accumulator->GetKey(), e.what()));
      }
   }

   Registry* const _registry;
   System::NativeMutex _mutex;
   std::set<Ref<PublishedAccumulatorImpl>, ByKey> _accumulators PELMORA_GUARDED_BY(_mutex);
   int _keyLimit PELMORA_GUARDED_BY(_mutex) = kDefaultPublishedKeyLimit;
   long long _refusedCount PELMORA_GUARDED_BY(_mutex) = 0;
   // Set when the limit refused a key and was logged; cleared when a new key fits again.
   bool _limitLogged PELMORA_GUARDED_BY(_mutex) = false;
};

// The calling thread's builder and how deep its TlsScopes are nested.
class TlsBuilderHolder : public ObjectImpl {
public:
   TlsBuilderHolder() { CreateLwStatsBuilder(builder); }
   Ref<LwStatsBuilder> builder;
   int depth = 0;
};

TlsBuilderHolder* GetTlsBuilderHolder() {
   static const int key = System::ReserveTlsKey();
   System::Thread* thread = System::GetThisThread();
   auto* holder = dynamic_cast<TlsBuilderHolder*>(thread->GetTls(key));
   if (!holder) {
      Ref<TlsBuilderHolder> created = new TlsBuilderHolder();
      thread->SetTls(key, created.Get());
      holder = created.Get();
   }
   return holder;
}

}  // namespace

void CreatePublishedAccumulator(Registry* registry, LwAccumulator* accumulator,
                                Ref<PublishedAccumulator>& out) {
   if (!accumulator) throw InvalidArgumentException();
   out = new PublishedAccumulatorImpl(registry, accumulator->GetName(), accumulator);
}

PublishedAccumulatorMap* GetPublishedAccumulatorMap() {
   // Never destroyed, like the registry it publishes in.
   static PublishedAccumulatorMapImpl* const map = [] {
      auto* created = new PublishedAccumulatorMapImpl(GetCounterRegistry());
      created->IncRef();
      return created;
   }();
   return map;
}

void CreatePublishedAccumulatorMap(Registry* registry, Ref<PublishedAccumulatorMap>& out) {
   out = new PublishedAccumulatorMapImpl(registry);
}

LwStatsBuilder* GetTlsMapBuilder() { return GetTlsBuilderHolder()->builder.Get(); }

TlsScope::TlsScope(PublishedAccumulatorMap* map)
   : _map(map), _builder(GetTlsMapBuilder()), _outermost(GetTlsBuilderHolder()->depth++ == 0) {}

TlsScope::~TlsScope() {
   --GetTlsBuilderHolder()->depth;
   if (!_outermost) return;
   try {
      _map->Merge(*_builder);
   } catch (const std::exception& e) {
      Internal::LogText(Internal::kLogError,
                        MessageFormatter::ASPrint("While merging TLS counters: %1", e.what()));
   }
   _builder->Reset();
}

}  // namespace Pelmora::PerfCounter
