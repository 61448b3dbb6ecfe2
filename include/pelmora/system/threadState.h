#pragma once
// The thread-state board: each thread posts short status messages ("serving request 12")
// into 16 fixed cells, and a diagnostic dump reads every thread's messages without
// locking the writers. A ThreadState belongs to its thread: only that thread adds and
// removes; any thread may copy it. The process-wide registry holds the boards weakly, so
// a thread's entry goes when the thread ends.

#include <list>
#include <map>
#include <string>

#include "pelmora/object/export.h"
#include "pelmora/object/weak.h"

namespace Pelmora::System {

constexpr unsigned THREAD_STATE_MAXIMUM_MESSAGES = 16;
// Stands for the messages of a thread whose board changed under every copy attempt.
extern PELMORA_EXPORT const char THREAD_STATE_READFAILED_TOKEN[];

class PELMORA_EXPORT ThreadState : public virtual WeakLinkable {
public:
   // Posts at most 255 characters of `text`. Returns the cell for Remove, or
   // THREAD_STATE_MAXIMUM_MESSAGES when every cell is taken (only counted then).
   virtual unsigned Add(const char* text) = 0;
   virtual void Remove(unsigned index) = 0;
   // Any thread: replaces `messages` with the posted texts, oldest first. Retries a copy
   // torn by a concurrent change up to `attempts` times in all; false if none was whole.
   virtual bool CopyState(std::list<std::string>& messages, int attempts) const = 0;
};

// The calling thread's board, created and registered on first use.
PELMORA_EXPORT ThreadState* GetThreadState();
PELMORA_EXPORT unsigned AddThreadState(const char* text);
PELMORA_EXPORT void RemoveThreadState(unsigned index);
// Appends every living thread's messages to result[thread id]; a board that could not be
// read whole gives the single text THREAD_STATE_READFAILED_TOKEN.
PELMORA_EXPORT void CopyThreadStates(std::map<long long, std::list<std::string>>& result, int attempts);

}  // namespace Pelmora::System
