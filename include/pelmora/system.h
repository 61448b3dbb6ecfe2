#pragma once
// System services: the system factory, backtraces, locks, conditions, threads and TLS.

#include "pelmora/exception/backtrace.h"
#include "pelmora/system/condition.h"
#include "pelmora/system/lockable.h"
#include "pelmora/system/multiSynchronized.h"
#include "pelmora/system/rwLock.h"
#include "pelmora/system/systemFactory.h"
#include "pelmora/system/thread.h"
#include "pelmora/system/threadState.h"
