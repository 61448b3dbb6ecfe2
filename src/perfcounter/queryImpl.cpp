// Queries: the compiled selection and its upkeep, and the two ways of selecting.

#include "src/perfcounter/queryImpl.h"

#include <boost/regex.hpp>

#include <algorithm>
#include <unordered_set>

#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"

namespace Pelmora::PerfCounter {

// The final classes leave the registry first; this catches any that does not.
QueryImpl::~QueryImpl() { Uninitialize(); }

void QueryImpl::SetQueryOption(QueryOption option, bool value) {
   System::NativeSynchronized lock(_mutex);
   switch (option) {
      case QUERY_OPTION_TRACK_NEW_COUNTERS: _trackNewCounters = value; return;
      case QUERY_OPTION_SORT_BY_NAME: _sortByName = value; return;
   }
   throw InvalidArgumentException(std::to_string(static_cast<int>(option)));
}

bool QueryImpl::GetQueryOption(QueryOption option) const {
   System::NativeSynchronized lock(_mutex);
   switch (option) {
      case QUERY_OPTION_TRACK_NEW_COUNTERS: return _trackNewCounters;
      case QUERY_OPTION_SORT_BY_NAME: return _sortByName;
   }
   throw InvalidArgumentException(std::to_string(static_cast<int>(option)));
}

void QueryImpl::Initialize() {
   PELMORA_VERIFY(!_registry->IsWriteLocked());
   // Under the read lock no group can come or go between joining and compiling.
   RegistryReadGuard guard(_registry);
   _registry->AddQuery(this);
   System::NativeSynchronized lock(_mutex);
   _state = INITIALIZED;
   Compile();
}

void QueryImpl::Compile() {
   PELMORA_VERIFY(_registry->IsReadLocked() || _registry->IsWriteLocked());
   _selection.clear();
   SelectFromTree();
   _state = COMPILED;
}

void QueryImpl::Select(CounterNode* node) {
   Selected& selected = _selection[node->group->GetSequence()];
   if (!selected.firstNode) {
      selected.group = node->group;
      selected.firstNode = node;
   }
   CounterNode* firstNode = selected.firstNode;
   // A group is collected with one call, so all of its counters must share the publisher.
   PELMORA_VERIFY(node->GetPublisher() == firstNode->GetPublisher());
   std::vector<int>& indices = selected.indices;
   auto at = std::lower_bound(indices.begin(), indices.end(), node->index);
   if (at == indices.end() || *at != node->index) indices.insert(at, node->index);
}

void QueryImpl::Execute(QueryResults& results) {
   {
      // Without a registry there is nothing to lock: fail before touching it.
      System::NativeSynchronized lock(_mutex);
      if (_state == UNINITIALIZED) PELMORA_VERIFY(_state == COMPILED);
   }
   RegistryReadGuard guard(_registry);
   System::NativeSynchronized lock(_mutex);
   if (_state == INITIALIZED) Compile();
   PELMORA_VERIFY(_state == COMPILED);
   size_t first = results.size();
   std::vector<Value> values;
   for (auto& [sequence, selected] : _selection) {
      selected.group->CollectValues(values);
      RefVector<Metadata>& metadata = selected.group->GetMetadata();
      for (int index : selected.indices) results.push_back({metadata[index], values[index]});
   }
   if (_sortByName) {
      std::sort(results.begin() + static_cast<std::ptrdiff_t>(first), results.end(),
                [](const QueryResult& a, const QueryResult& b) {
                   return a.metadata->GetName() < b.metadata->GetName();
                });
   }
}

void QueryImpl::Clear() {
   System::NativeSynchronized lock(_mutex);
   if (_state != COMPILED) return;
   _selection.clear();
   _state = INITIALIZED;
}

void QueryImpl::Uninitialize() {
   {
      System::NativeSynchronized lock(_mutex);
      if (_state == UNINITIALIZED) return;
   }
   // The query list comes before the query's own mutex. The registry may be gone by now:
   // only the shared list is touched.
   {
      System::NativeSynchronized lock(_queryList->mutex);
      _queryList->queries.erase(this);
   }
   System::NativeSynchronized lock(_mutex);
   _selection.clear();
   _state = UNINITIALIZED;
}

void QueryImpl::OnGroupAdded(GroupImpl* group) {
   System::NativeSynchronized lock(_mutex);
   // An initialised query reads the whole tree when it compiles.
   if (_state != COMPILED || !_trackNewCounters) return;
   RefVector<Metadata>& metadata = group->GetMetadata();
   for (size_t i = 0; i < metadata.size(); ++i) {
      if (!Matches(metadata[i]->GetName())) continue;
      Select(_registry->FindNode(metadata[i]->GetName()));
   }
}

void QueryImpl::OnGroupRemoved(GroupImpl* group) {
   System::NativeSynchronized lock(_mutex);
   _selection.erase(group->GetSequence());
}

void QueryImpl::OnRegistryGone() {
   System::NativeSynchronized lock(_mutex);
   _selection.clear();
   _state = UNINITIALIZED;
}

std::string QueryImpl::ToString() const {
   System::NativeSynchronized lock(_mutex);
   size_t counters = 0;
   for (const auto& [sequence, selected] : _selection) counters += selected.indices.size();
   static const char* const kStates[] = {"uninitialized", "initialized", "compiled"};
   return ObjectImpl::ToString() + " " + DescribeCriteria() + " state=" + kStates[_state] +
          " selected=" + std::to_string(counters);
}

namespace {

class NamesQueryImpl : public QueryImpl {
public:
   NamesQueryImpl(RegistryImpl* registry, const std::vector<std::string>& names)
      : QueryImpl(registry), _names(names.begin(), names.end()) {}
   // Leaves the registry while Matches still works: until then the registry may call it.
   ~NamesQueryImpl() override { Uninitialize(); }

protected:
   bool Matches(const std::string& name) const override { return _names.count(name) != 0; }
   void SelectFromTree() PELMORA_REQUIRES(_mutex) override {
      for (const std::string& name : _names) {
         CounterNode* node = _registry->FindNode(name);
         if (node && node->group) Select(node);
      }
   }
   std::string DescribeCriteria() const override {
      std::vector<std::string> sorted(_names.begin(), _names.end());
      std::sort(sorted.begin(), sorted.end());
      std::string text = "names={";
      for (const std::string& name : sorted) text += " " + name;
      return text + " }";
   }

private:
   const std::unordered_set<std::string> _names;
};

class RegexQueryImpl : public QueryImpl {
public:
   RegexQueryImpl(RegistryImpl* registry, const std::string& pattern, bool caseSensitive)
      : QueryImpl(registry), _pattern(pattern), _caseSensitive(caseSensitive),
        _regex(Compile(pattern, caseSensitive)) {}
   // Leaves the registry while the expression is still alive: until then the registry may
   // call Matches.
   ~RegexQueryImpl() override { Uninitialize(); }

protected:
   // A search: the pattern may match anywhere in the name.
   bool Matches(const std::string& name) const override { return boost::regex_search(name, _regex); }
   void SelectFromTree() PELMORA_REQUIRES(_mutex) override {
      // The visitor runs within this call, under the lock the analysis cannot see it hold.
      _registry->ForEachCounter([this](CounterNode* node) PELMORA_NO_THREAD_SAFETY_ANALYSIS {
         if (Matches(node->GetMetadata()->GetName())) Select(node);
      });
   }
   std::string DescribeCriteria() const override {
      return "pattern=" + _pattern + (_caseSensitive ? "" : " (ignoring case)");
   }

private:
   static boost::regex Compile(const std::string& pattern, bool caseSensitive) {
      try {
         return boost::regex(pattern, caseSensitive ? boost::regex::perl
                                                    : boost::regex::perl | boost::regex::icase);
      } catch (const boost::regex_error&) {
         throw InvalidArgumentException(pattern);
      }
   }

   const std::string _pattern;
   const bool _caseSensitive;
   const boost::regex _regex;
};

}  // namespace

void RegistryImpl::CreateNamesQuery(std::vector<std::string>& names, Ref<Query>& out) {
   Ref<QueryImpl> query = new NamesQueryImpl(this, names);
   query->Initialize();
   out = query;
}

void RegistryImpl::CreateRegexQuery(const std::string& pattern, bool caseSensitive,
                                    Ref<Query>& out) {
   Ref<QueryImpl> query = new RegexQueryImpl(this, pattern, caseSensitive);
   query->Initialize();
   out = query;
}

}  // namespace Pelmora::PerfCounter
