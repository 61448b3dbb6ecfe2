#pragma once
// The service framework: logging, configuration and journals.

#include "pelmora/service/config.h"
#include "pelmora/service/journal.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/service/logWriters.h"
#include "pelmora/service/logger.h"
