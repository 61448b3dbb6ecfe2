#pragma once
// The service framework: logging and configuration.

#include "pelmora/service/config.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/service/logWriters.h"
#include "pelmora/service/logger.h"
