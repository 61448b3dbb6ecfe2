#pragma once
// The debug settings that shape diagnostics, owned by the application: how many frames
// of an exception's backtrace FormatThrowable prints (0: none), and the reference frames
// (the stack shared by every thread's outer end) trimmed from those backtraces.
// Thread-safe.

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"
#include "pelmora/exception/backtrace.h"

namespace Pelmora::Service {

class PELMORA_EXPORT DebugConfig {
public:
   virtual int GetExceptionBacktrace() const = 0;
   virtual void SetExceptionBacktrace(int maxFrames) = 0;
   virtual Ref<System::Backtrace> GetReferenceFrames() const = 0;
   virtual void SetReferenceFrames(const Ref<System::Backtrace>& frames) = 0;
   // Start-up switches the application reads with the rest: load debug symbols early,
   // make the libraries a core dump needs resident early, name frames by symbol.
   virtual bool GetPrefetchSymbols() const = 0;
   virtual void SetPrefetchSymbols(bool on) = 0;
   virtual bool GetPrefetchCoreDumpLibs() const = 0;
   virtual void SetPrefetchCoreDumpLibs(bool on) = 0;
   virtual bool GetResolveSymbols() const = 0;
   virtual void SetResolveSymbols(bool on) = 0;

protected:
   ~DebugConfig() = default;
};

// The process-wide debug configuration; alive until exit.
PELMORA_EXPORT DebugConfig& GetDebugConfig();

}  // namespace Pelmora::Service
