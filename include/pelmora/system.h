#pragma once
// System services: the system factory and backtraces.

#include "pelmora/system/backtrace.h"
#include "pelmora/system/systemFactory.h"
