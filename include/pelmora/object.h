#pragma once
// Objects, references, weak references, reference containers and the scoreboard.

#include "pelmora/object/atomic.h"
#include "pelmora/object/containers.h"
#include "pelmora/object/ref.h"
#include "pelmora/object/scoreboard.h"
#include "pelmora/object/weak.h"
