// The process-wide debug settings.

#include "pelmora/exception/debugConfig.h"

#include <atomic>
#include <mutex>

namespace Pelmora::Service {

namespace {

class DebugConfigImpl : public DebugConfig {
public:
   int GetExceptionBacktrace() const override {
      return _exceptionBacktrace.load(std::memory_order_relaxed);
   }
   void SetExceptionBacktrace(int maxFrames) override {
      _exceptionBacktrace.store(maxFrames, std::memory_order_relaxed);
   }
   Ref<System::Backtrace> GetReferenceFrames() const override {
      std::lock_guard<std::mutex> lock(_mutex);
      return _referenceFrames;
   }
   void SetReferenceFrames(const Ref<System::Backtrace>& frames) override {
      std::lock_guard<std::mutex> lock(_mutex);
      _referenceFrames = frames;
   }

   bool GetPrefetchSymbols() const override { return _prefetchSymbols.load(); }
   void SetPrefetchSymbols(bool on) override { _prefetchSymbols.store(on); }
   bool GetPrefetchCoreDumpLibs() const override { return _prefetchCoreDumpLibs.load(); }
   void SetPrefetchCoreDumpLibs(bool on) override { _prefetchCoreDumpLibs.store(on); }
   bool GetResolveSymbols() const override { return _resolveSymbols.load(); }
   void SetResolveSymbols(bool on) override { _resolveSymbols.store(on); }

private:
   std::atomic<bool> _prefetchSymbols{false};
   std::atomic<bool> _prefetchCoreDumpLibs{false};
   std::atomic<bool> _resolveSymbols{true};
   std::atomic<int> _exceptionBacktrace{0};
   mutable std::mutex _mutex;
   Ref<System::Backtrace> _referenceFrames;
};

}  // namespace

DebugConfig& GetDebugConfig() {
   static DebugConfigImpl* const config = new DebugConfigImpl();  // kept until exit
   return *config;
}

}  // namespace Pelmora::Service
