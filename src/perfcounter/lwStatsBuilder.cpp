// The statistics builder: accumulators by composite key under a namespace stack.

#include <map>
#include <set>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/perfCounter/lwStats.h"

namespace Pelmora::PerfCounter {

namespace {

// The namespace stack only grows and shrinks at its end.
template <class T>
using GrowableArray = std::vector<T>;

class LwStatsBuilderImpl : public virtual LwStatsBuilder, public ObjectImpl {
public:
   void Push(const std::string& name) override {
      _namespaces.push_back({_prefix.size()});
      _prefix += name;
      _prefix += '/';
   }

   void Push(const std::string& name, const std::string& value) override {
      _namespaces.push_back({_prefix.size()});
      _prefix += name;
      _prefix += "='";
      _prefix += value;
      _prefix += "'/";
   }

   void Pop() override {
      PELMORA_VERIFY(!_namespaces.empty());
      _prefix.resize(_namespaces.back().prefixLength);
      _namespaces.pop_back();
   }

   void Insert(const std::string& name, LwAccumulator* accumulator,
               const FactoryBase& factory) override {
      if (!accumulator) throw InvalidArgumentException();
      std::string key = _prefix + name;
      auto it = _accumulators.find(key);
      if (it != _accumulators.end()) {
         it->second->Merge(accumulator);
         return;
      }
      if (!IsAcceptedKey(key)) return;
      Ref<LwAccumulator> created;
      factory.Create(key, created);
      created->Merge(accumulator);  // before it is kept: a refused merge leaves nothing
      _accumulators.emplace(std::move(key), std::move(created));
   }

   void Insert(const std::string& name, long long value, const FactoryBase& factory) override {
      std::string key = _prefix + name;
      auto it = _accumulators.find(key);
      if (it == _accumulators.end()) {
         if (!IsAcceptedKey(key)) return;
         Ref<LwAccumulator> created;
         factory.Create(key, created);
         it = _accumulators.emplace(key, std::move(created)).first;
      } else if (it->second->GetType() != factory.GetType()) {
         throw InvalidArgumentException(key);
      }
      it->second->Sample(value);
   }

   bool GetTotalCount(const std::string& name, long long& out) const override {
      auto it = _accumulators.find(_prefix + name);
      if (it == _accumulators.end()) return false;
      out = it->second->GetTotal();
      return true;
   }

   void Serialize(Writer* writer) const override {
      for (const auto& [key, accumulator] : _accumulators) {
         std::string line = key + " " + accumulator->Describe() + "\n";
         writer->Write(line.data(), static_cast<int>(line.size()));
      }
   }

   void Reset() override {
      _accumulators.clear();
      _namespaces.clear();
      _prefix.clear();
      _invalidKeys.clear();
   }

   void Swap(LwStatsBuilder& other) override {
      auto* impl = dynamic_cast<LwStatsBuilderImpl*>(&other);
      if (!impl) ThrowTypeMismatchException(typeid(LwStatsBuilderImpl), typeid(other));
      _accumulators.swap(impl->_accumulators);
      _namespaces.swap(impl->_namespaces);
      _prefix.swap(impl->_prefix);
      _invalidKeys.swap(impl->_invalidKeys);
   }

   void GetEntries(std::vector<std::pair<Ref<LwAccumulator>, std::string>>& out) const override {
      for (const auto& [key, accumulator] : _accumulators) out.emplace_back(accumulator, key);
   }

   int GetSize() const override { return static_cast<int>(_accumulators.size()); }

private:
   struct Namespace {
      size_t prefixLength;  // of _prefix before this namespace was entered
   };

   // A bad key is logged once per builder, not on every sample.
   bool IsAcceptedKey(const std::string& key) {
      if (_invalidKeys.count(key)) return false;
      if (ValidateStatsScope(key)) return true;
      _invalidKeys.insert(key);
      return false;
   }

   GrowableArray<Namespace> _namespaces;
   std::string _prefix;  // the namespaces joined, each followed by "/"
   std::map<std::string, Ref<LwAccumulator>> _accumulators;
   std::set<std::string> _invalidKeys;
};

}  // namespace

void CreateLwStatsBuilder(Ref<LwStatsBuilder>& out) { out = new LwStatsBuilderImpl(); }

}  // namespace Pelmora::PerfCounter
