#pragma once
// Performance counters: the registry and its queries, meters, light-weight statistics,
// their publication and the Prometheus text export.

#include "pelmora/perfCounter/counter.h"
#include "pelmora/perfCounter/lwStats.h"
#include "pelmora/object/lwStatsProvider.h"
#include "pelmora/perfCounter/meter.h"
#include "pelmora/perfCounter/prometheus.h"
#include "pelmora/perfCounter/publishedMap.h"
#include "pelmora/perfCounter/registry.h"
