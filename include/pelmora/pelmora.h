#pragma once
// Every public family of the library.

#include "pelmora/authorize.h"
#include "pelmora/exception.h"
#include "pelmora/formatter.h"
#include "pelmora/http.h"
#include "pelmora/io.h"
#include "pelmora/object.h"
#include "pelmora/perfCounter.h"
#include "pelmora/service.h"
#include "pelmora/soap.h"
#include "pelmora/system.h"
#include "pelmora/xml.h"
