#pragma once
// What a Linux daemon is expected to do, as the application object drives it at start-up
// and exit; each piece is usable on its own. Configuration keys (under "pelmora/daemon"
// unless said otherwise) are read by Init:
//   handleSignals (true)   SIGTERM and SIGINT stop the application; SIGHUP reopens the
//                          log files and refreshes the configuration
//   pidFile                the file that holds the process id while it runs
//   watchdogIntervalMs     overrides half of WATCHDOG_USEC as the watchdog period
// All thread-safe.

#include <functional>
#include <string>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora::Service {

// Signal handling without work inside a handler: the handler only writes the signal's
// number to a pipe, and one thread of its own calls `onSignal` for it. Installed for
// SIGTERM, SIGINT and SIGHUP until StopSignalThread. Starting it twice throws
// AlreadyInitializedException.
using SignalCallback = std::function<void(int signalNumber)>;
PELMORA_EXPORT void StartSignalThread(const SignalCallback& onSignal);
// Restores the default actions and joins the thread.
PELMORA_EXPORT void StopSignalThread();

// The service manager's notification socket ($NOTIFY_SOCKET: a path, or "@name" for the
// abstract namespace). Each Send is one datagram of "KEY=value" lines; without the
// variable nothing is sent. Send returns whether the datagram went out.
class PELMORA_EXPORT Notifier : public virtual Object {
public:
   virtual bool IsEnabled() const = 0;
   virtual bool Send(const std::string& state) = 0;
   // Sends "WATCHDOG=1" every `intervalMicroseconds` from a thread of its own until
   // StopWatchdog; nothing for a period not above 0.
   virtual void StartWatchdog(long long intervalMicroseconds) = 0;
   virtual void StopWatchdog() = 0;
};
// From $NOTIFY_SOCKET.
PELMORA_EXPORT void CreateNotifier(Ref<Notifier>& out);
PELMORA_EXPORT void CreateNotifier(const std::string& socketName, Ref<Notifier>& out);
// Half of $WATCHDOG_USEC when it is set for this process ($WATCHDOG_PID absent or equal
// to our id), else 0.
PELMORA_EXPORT long long GetWatchdogPeriodFromEnvironment();

// Writes the process id to `path` through a temporary file renamed over it, so a reader
// sees the old file or the whole new one; SystemException on failure.
PELMORA_EXPORT void WritePidFile(const std::string& path);
// Removes `path` when it still holds this process's id; returns whether it did.
PELMORA_EXPORT bool RemovePidFile(const std::string& path);

// Reaps children on a thread of its own so that none stays a zombie, and keeps each exit
// status (the waitpid form) until asked for. The thread waits for any child, so a
// program using the reaper leaves waiting to it. Idle, it checks for new children every
// `idlePollMs` or at once after NotifyChildStarted.
class PELMORA_EXPORT ChildReaper : public virtual Object {
public:
   // Wakes the reaper for a new child.
   virtual void NotifyChildStarted() = 0;
   // The status of `pid` once reaped (then forgotten); false while it runs or for a
   // process not our child.
   virtual bool TakeStatus(int pid, int& status) = 0;
   // Waits up to `timeoutMs` for `pid` to be reaped.
   virtual bool WaitStatus(int pid, int timeoutMs, int& status) = 0;
   virtual void Stop() = 0;
};
// The first reaper made becomes the process's (GetChildReaper) until Exit.
PELMORA_EXPORT void CreateChildReaper(int idlePollMs, Ref<ChildReaper>& out);
// The process's reaper (Init makes it when "pelmora/sysCommand/enable" is true), or null.
PELMORA_EXPORT ChildReaper* GetChildReaper();

// Impersonation: the process drops to `user` (and `group`, else the user's primary group)
// for good, with the user's supplementary groups. Started as root and told to drop, a
// process that would still be root afterwards throws InvalidStateException rather than
// run on. NotFoundException for an unknown user or group; SystemException when a call fails.
PELMORA_EXPORT void Impersonate(const std::string& user, const std::string& group);

// Core dumps and panic reports: allows core files of any size (RLIMIT_CORE), keeps the
// process dumpable after a change of user, makes `directory` and sends every panic-level
// line (a panic report with its recent log lines) also to the file `directory`/`name`.
// Core files themselves go where the kernel's core pattern says.
PELMORA_EXPORT void SetPanicLocation(const std::string& directory, const std::string& name);
// The file panic reports go to; empty before SetPanicLocation.
PELMORA_EXPORT std::string GetPanicLocation();

// Writes a backtrace to standard error when the process dies of SIGSEGV, SIGBUS, SIGILL or
// SIGFPE, then dies of the signal as it would have.
PELMORA_EXPORT void EnableStackTracer();

// The allocation-failure handler: the first thread whose allocation fails logs the
// out-of-memory message and ends the process through a panic; a second failure on that
// thread aborts at once; other threads wait for the end.
PELMORA_EXPORT void InstallNewHandler();

}  // namespace Pelmora::Service
