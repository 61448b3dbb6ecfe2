#pragma once
// The service framework: logging.

#include "pelmora/service/logMacros.h"
#include "pelmora/service/logWriters.h"
#include "pelmora/service/logger.h"
