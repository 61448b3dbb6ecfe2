#pragma once
// Writes every counter of a registry in the Prometheus text exposition format, version
// 0.0.4, for a metrics endpoint to serve. Thread-safe as the registry's queries are.
//
// Counter paths become metric names by this rule:
// - The path's components are joined with "_", the leading "/" dropped. Every byte outside
//   [A-Za-z0-9_] becomes "_"; a name that would start with a digit gets a leading "_".
// - A component of the form Name='value' (Name a valid label name, not starting with "__",
//   not "quantile"), other than the last, becomes the label Name="value" instead of a part
//   of the name; a second component with the same label name stays part of the name.
// - Counters of type counter and gauge are families of those types. The five fields of a
//   meter at path P form a summary family for P: the total is its _sum, the sample count
//   its _count, the minimum and maximum its quantiles "0" and "1"; the mean is the gauge
//   family P_mean. A meter without samples shows NaN for minimum, maximum and mean.
// - Where two counters map to the same series, or a name is taken by a family of another
//   type, the one later in name order is left out.
// Each family has a HELP line naming the counter path (label values shown as '*') and a
// TYPE line; families come in name order.

#include "pelmora/object/export.h"
#include "pelmora/io/readerWriter.h"
#include "pelmora/perfCounter/registry.h"

namespace Pelmora::PerfCounter {

PELMORA_EXPORT void WritePrometheusText(Registry* registry, Writer* writer);

}  // namespace Pelmora::PerfCounter
