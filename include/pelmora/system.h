#pragma once
// System services: the system factory, backtraces, locks, conditions, threads, TLS and
// the thread pool with its work queues, streams, sockets, TLS and binding information.

#include "pelmora/exception/backtrace.h"
#include "pelmora/system/condition.h"
#include "pelmora/system/functor.h"
#include "pelmora/system/lockable.h"
#include "pelmora/system/address.h"
#include "pelmora/system/multiSynchronized.h"
#include "pelmora/system/rwLock.h"
#include "pelmora/system/socket.h"
#include "pelmora/system/ssl.h"
#include "pelmora/system/stream.h"
#include "pelmora/system/streamFileSender.h"
#include "pelmora/system/systemFactory.h"
#include "pelmora/system/thread.h"
#include "pelmora/system/threadPool.h"
#include "pelmora/system/threadPoolWorkBinder.h"
#include "pelmora/system/threadState.h"
#include "pelmora/system/workQueue.h"
