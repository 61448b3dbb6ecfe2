#pragma once
// The service framework: logging, configuration, journals and the application object.

#include "pelmora/service/config.h"
#include "pelmora/service/journal.h"
#include "pelmora/service/logMacros.h"
#include "pelmora/service/logWriters.h"
#include "pelmora/service/logger.h"
#include "pelmora/service/app.h"
#include "pelmora/service/appChannels.h"
#include "pelmora/service/daemon.h"
#include "pelmora/service/plugin.h"
