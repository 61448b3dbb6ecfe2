#pragma once
// Exceptions, panics and the verify macro.

#include "pelmora/exception/debugConfig.h"
#include "pelmora/exception/exceptions.h"
#include "pelmora/exception/panic.h"
#include "pelmora/exception/throwable.h"
