#pragma once
// Format strings with numbered placeholders, argument formatters and the date-time type.

#include "pelmora/formatter/dateTime.h"
#include "pelmora/formatter/messageFormatter.h"
#include "pelmora/formatter/printFormatter.h"
