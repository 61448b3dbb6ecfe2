// The reference tracker: for chosen classes, where their live instances were first
// referenced, counted per backtrace.

#include <algorithm>
#include <atomic>
#include <unordered_map>
#include <vector>

#include "pelmora/exception/panic.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/object/scoreboard.h"
#include "pelmora/exception/backtrace.h"
#include "src/internal/nativeMutex.h"

namespace Pelmora {

namespace {

class RefTrackerImpl : public virtual RefTracker, public ObjectImpl {
public:
   explicit RefTrackerImpl(const std::unordered_set<std::string>& classNames)
      : _classNames(classNames) {}

   void OnFirstIncRef(Object* obj, const std::type_info& type) override {
      PELMORA_VERIFY(obj != NULL);
      const char* name = TypeName(type);
      if (!name || _classNames.count(name) == 0) return;
      Ref<System::Backtrace> backtrace;
      // Start at the code that took the reference: skip this, FirstIncRef and IncRef.
      System::CaptureBacktrace(3, backtrace);
      std::string text = backtrace->GetText();
      System::NativeSynchronized lock(_mutex);
      Record& record = _records.try_emplace(text, Record{name, 0}).first->second;
      ++record.count;
      _objects[obj] = &_records.find(text)->first;
   }

   void OnFinalDecRef(Object* obj, const std::type_info&) override {
      System::NativeSynchronized lock(_mutex);
      auto it = _objects.find(obj);
      if (it == _objects.end()) return;
      auto record = _records.find(*it->second);
      if (--record->second.count == 0) _records.erase(record);
      _objects.erase(it);
   }

   void GetScores(std::string& out) override {
      out += "\n";
      System::NativeSynchronized lock(_mutex);
      std::vector<std::string> names(_classNames.begin(), _classNames.end());
      std::sort(names.begin(), names.end());
      for (const std::string& name : names) {
         std::vector<std::pair<const std::string*, int>> traces;
         for (const auto& [text, record] : _records) {
            if (record.className == name) traces.emplace_back(&text, record.count);
         }
         std::stable_sort(traces.begin(), traces.end(),
                          [](const auto& a, const auto& b) { return a.second > b.second; });
         for (const auto& [text, count] : traces) {
            out += MessageFormatter::ASPrint("Trace (%1, count:%2):\n", name, count);
            out += *text;
            out += "\n";
         }
      }
   }

private:
   struct Record {
      std::string className;
      int count;
   };

   const std::unordered_set<std::string> _classNames;
   System::NativeMutex _mutex;
   std::unordered_map<std::string, Record> _records PELMORA_GUARDED_BY(_mutex);  // by backtrace text
   std::unordered_map<const Object*, const std::string*> _objects PELMORA_GUARDED_BY(_mutex);  // to a key of _records
};

std::atomic<RefTracker*> g_tracker{nullptr};

}  // namespace

void CreateRefTracker(const std::unordered_set<std::string>& classNames, Ref<RefTracker>& out) {
   out = new RefTrackerImpl(classNames);
   // Installed trackers are kept until exit: objects may die during static destruction.
   out->IncRef();
   RefTracker* previous = g_tracker.exchange(out.Get(), std::memory_order_acq_rel);
   (void)previous;  // an earlier tracker stays alive for threads that may still hold it
}

RefTracker* GetRefTracker() { return g_tracker.load(std::memory_order_acquire); }

}  // namespace Pelmora
