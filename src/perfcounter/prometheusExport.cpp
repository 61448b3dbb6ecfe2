// The registry in the Prometheus text exposition format 0.0.4; the naming rule is in the
// public header.

#include "pelmora/perfCounter/prometheus.h"

#include <algorithm>
#include <charconv>
#include <cstring>
#include <memory_resource>
#include <initializer_list>
#include <optional>
#include <string_view>
#include <unordered_map>
#include <unordered_set>

#include "pelmora/exception/panic.h"
#include "pelmora/perfCounter/meter.h"

namespace Pelmora::PerfCounter {

namespace {

using Labels = std::vector<std::pair<std::string, std::string>>;

struct MappedPath {
   std::string name;
   Labels labels;
   std::string pattern;  // the path with label values shown as '*'
};

bool IsNameStart(char c) { return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || c == '_'; }
bool IsNameChar(char c) { return IsNameStart(c) || (c >= '0' && c <= '9'); }

// Name='value' with a usable label name; `quantile` belongs to summaries.
bool AsLabel(std::string_view part, std::string_view& name, std::string_view& value) {
   size_t equals = part.find("='");
   if (equals == std::string_view::npos || equals == 0 || part.size() < equals + 3 ||
       part.back() != '\'') {
      return false;
   }
   std::string_view labelName = part.substr(0, equals);
   if (!IsNameStart(labelName[0]) || labelName.substr(0, 2) == "__" || labelName == "quantile") {
      return false;
   }
   for (char c : labelName) {
      if (!IsNameChar(c)) return false;
   }
   name = labelName;
   value = part.substr(equals + 2, part.size() - equals - 3);
   return true;
}

// Fills `mapped` (reused across counters to keep its buffers). The name and the pattern
// are written into buffers sized once for the path and cut to length at the end: an
// append per piece cost most of the export's time.
void MapPath(std::string_view path, MappedPath& mapped) {
   mapped.labels.clear();
   // The name is at most the path and a leading '_'; the pattern at most the path and
   // one more character per label (an empty value becomes '*').
   mapped.name.resize(path.size() + 1);
   mapped.pattern.resize(path.size() * 2 + 2);
   char* const nameStart = mapped.name.data();
   char* name = nameStart + 1;  // room for a leading '_'
   char* pattern = mapped.pattern.data();
   auto put = [](char*& to, std::string_view text) {
      std::memcpy(to, text.data(), text.size());
      to += text.size();
   };
   std::string_view labelName, labelValue;
   for (size_t start = 1; start <= path.size();) {
      size_t slash = path.find('/', start);
      // The last component names the measurement and is never a label.
      bool last = slash == std::string_view::npos;
      if (last) slash = path.size();
      std::string_view part = path.substr(start, slash - start);
      start = slash + 1;
      if (!last && AsLabel(part, labelName, labelValue)) {
         bool taken = false;
         for (const auto& label : mapped.labels) taken = taken || label.first == labelName;
         if (!taken) {
            *pattern++ = '/';
            put(pattern, labelName);
            put(pattern, "='*'");
            mapped.labels.emplace_back(std::string(labelName), std::string(labelValue));
            continue;
         }
      }
      *pattern++ = '/';
      put(pattern, part);
      if (name != nameStart + 1) *name++ = '_';
      for (char c : part) *name++ = IsNameChar(c) ? c : '_';
   }
   mapped.pattern.resize(static_cast<size_t>(pattern - mapped.pattern.data()));
   const char* first = nameStart + 1;
   if (name == first || (*first >= '0' && *first <= '9')) {
      *nameStart = '_';
      first = nameStart;
   }
   mapped.name.erase(0, static_cast<size_t>(first - nameStart));
   mapped.name.resize(static_cast<size_t>(name - first));
}

void AppendEscaped(std::string& out, std::string_view text, bool quotes) {
   for (char c : text) {
      if (c == '\\') {
         out += "\\\\";
      } else if (c == '\n') {
         out += "\\n";
      } else if (c == '"' && quotes) {
         out += "\\\"";
      } else {
         out += c;
      }
   }
}

// Appends `base` followed by the label set, with one extra label when `extraName` is given.
void AppendSeriesName(std::string& text, std::string_view base, const Labels& labels,
                      const char* extraName = nullptr, const char* extraValue = nullptr) {
   text += base;
   if (labels.empty() && !extraName) return;
   text += '{';
   bool first = true;
   for (const auto& [name, value] : labels) {
      if (!first) text += ',';
      first = false;
      text += name;
      text += "=\"";
      AppendEscaped(text, value, true);
      text += '"';
   }
   if (extraName) {
      if (!first) text += ',';
      text += extraName;
      text += "=\"";
      text += extraValue;
      text += '"';
   }
   text += '}';
}

struct Series {
   std::string_view name;  // the sample's metric name with labels, in the exposition's store
   long long value;
   bool nan;  // the value is not a number: a meter without samples
};

struct Family {
   const char* type;
   std::string help;
   std::vector<Series> series;
};

// The families being built, and who owns each sample name so that a family of another
// type cannot claim it. Names are kept once, in a store whose text never moves, and
// looked up by view; families are put in name order only when written. The lookups
// allocate from one arena that goes with the exposition.
class Exposition {
public:
   explicit Exposition(size_t expected)
       : _owners(expected, &_arena), _seriesNames(expected, &_arena) {}

   // The series name of `base` with `labels` (and the extra label), kept in the store.
   std::string_view SeriesName(std::string_view base, const Labels& labels,
                               const char* extraName = nullptr, const char* extraValue = nullptr) {
      _scratch.clear();
      AppendSeriesName(_scratch, base, labels, extraName, extraValue);
      return Keep(_scratch);
   }

   // Whether `family` of `type` may take `sampleNames`: no family of that name has another
   // type and no other family owns one of the names.
   bool CanAdd(const std::string& family, const char* type,
               std::initializer_list<const std::string*> sampleNames) const {
      auto existing = _families.find(family);
      if (existing != _families.end() && existing->second.type != type) return false;
      for (const std::string* sample : sampleNames) {
         auto owner = _owners.find(*sample);
         if (owner != _owners.end() && *owner->second != family) return false;
      }
      return true;
   }

   // Adds the series of one family if nothing clashes; all or nothing. The help text,
   // `helpPrefix` and `pattern`, is kept from the family's first series.
   bool Add(const std::string& family, const char* type, const char* helpPrefix,
            const std::string& pattern, std::initializer_list<const std::string*> sampleNames,
            std::vector<Series>& series) {
      // Each name is hashed once: the family and the series are entered first and taken
      // out again on a clash, which is rare.
      auto [entry, added] = _families.try_emplace(family);
      Family& target = entry->second;
      if (!added && target.type != type) return false;
      const std::string* owners[3] = {};
      PELMORA_VERIFY(sampleNames.size() <= 3);
      size_t next = 0;
      bool clash = false;
      for (const std::string* sample : sampleNames) {
         auto owner = _owners.find(*sample);
         if (owner == _owners.end()) {
            owners[next++] = sample;
         } else if (owner->second != &entry->first) {
            clash = true;
         }
      }
      size_t entered = 0;
      while (!clash && entered < series.size()) {
         if (_seriesNames.insert(series[entered].name).second) {
            ++entered;
         } else {
            clash = true;
         }
      }
      if (clash) {
         for (size_t i = 0; i < entered; ++i) _seriesNames.erase(series[i].name);
         if (added) _families.erase(entry);
         return false;
      }
      if (added) {
         target.type = type;
         target.help = helpPrefix;
         target.help += pattern;
      }
      for (size_t i = 0; i < next; ++i) _owners.emplace(Keep(*owners[i]), &entry->first);
      target.series.insert(target.series.end(), series.begin(), series.end());
      return true;
   }

   void Write(Writer* writer) const {
      std::vector<const std::pair<const std::string, Family>*> ordered;
      ordered.reserve(_families.size());
      for (const auto& entry : _families) ordered.push_back(&entry);
      std::sort(ordered.begin(), ordered.end(),
                [](const auto* a, const auto* b) { return a->first < b->first; });
      std::string text;
      text.reserve(kFlushSize + 4096);
      char number[24];
      for (const auto* entry : ordered) {
         const std::string& name = entry->first;
         const Family& family = entry->second;
         text += "# HELP ";
         text += name;
         text += ' ';
         AppendEscaped(text, family.help, false);
         text += "\n# TYPE ";
         text += name;
         text += ' ';
         text += family.type;
         text += '\n';
         for (const Series& s : family.series) {
            text += s.name;
            text += ' ';
            if (s.nan) {
               text += "NaN";
            } else {
               char* end = std::to_chars(number, number + sizeof number, s.value).ptr;
               text.append(number, static_cast<size_t>(end - number));
            }
            text += '\n';
         }
         if (text.size() >= kFlushSize) Flush(writer, text);
      }
      Flush(writer, text);
   }

private:
   static constexpr size_t kFlushSize = 64 * 1024;

   static void Flush(Writer* writer, std::string& text) {
      if (!text.empty()) writer->Write(text.data(), static_cast<int>(text.size()));
      text.clear();
   }

   std::string_view Keep(std::string_view name) {
      void* text = _arena.allocate(name.size() + 1, 1);
      std::memcpy(text, name.data(), name.size());
      return {static_cast<const char*>(text), name.size()};
   }

   std::pmr::monotonic_buffer_resource _arena{64 * 1024};
   std::string _scratch;
   std::unordered_map<std::string, Family> _families;
   // Sample name to the name of the family that owns it (a key of _families).
   std::pmr::unordered_map<std::string_view, const std::string*> _owners;
   std::pmr::unordered_set<std::string_view> _seriesNames;
};

const char* const kSummary = "summary";
const char* const kGauge = "gauge";
const char* const kCounter = "counter";

struct MeterParts {
   std::string path;
   std::optional<long long> fields[Meter::kCounterCount];
};

void AddMeter(Exposition& out, const MeterParts& meter, MappedPath& mapped) {
   MapPath(meter.path, mapped);
   const std::string& name = mapped.name;
   const auto& fields = meter.fields;
   bool empty = fields[Meter::COUNTER_NUM_SAMPLES] && *fields[Meter::COUNTER_NUM_SAMPLES] == 0;
   auto series = [&](std::string_view seriesName, Meter::Counter c) {
      return Series{seriesName, *fields[c],
                    empty && c != Meter::COUNTER_TOTAL && c != Meter::COUNTER_NUM_SAMPLES};
   };
   std::vector<Series> summary;
   if (fields[Meter::COUNTER_MIN]) {
      summary.push_back(series(out.SeriesName(name, mapped.labels, "quantile", "0"), Meter::COUNTER_MIN));
   }
   if (fields[Meter::COUNTER_MAX]) {
      summary.push_back(series(out.SeriesName(name, mapped.labels, "quantile", "1"), Meter::COUNTER_MAX));
   }
   const std::string sumName = name + "_sum", countName = name + "_count";
   if (fields[Meter::COUNTER_TOTAL]) {
      summary.push_back(series(out.SeriesName(sumName, mapped.labels), Meter::COUNTER_TOTAL));
   }
   if (fields[Meter::COUNTER_NUM_SAMPLES]) {
      summary.push_back(series(out.SeriesName(countName, mapped.labels), Meter::COUNTER_NUM_SAMPLES));
   }
   const std::string meanName = name + "_mean";
   bool hasMean = fields[Meter::COUNTER_MEAN].has_value();
   if (hasMean && !out.CanAdd(meanName, kGauge, {&meanName})) return;
   if (!summary.empty() &&
       !out.Add(name, kSummary, "Meter ", mapped.pattern, {&name, &sumName, &countName}, summary)) {
      return;
   }
   if (hasMean) {
      std::vector<Series> mean;
      mean.push_back(series(out.SeriesName(meanName, mapped.labels), Meter::COUNTER_MEAN));
      out.Add(meanName, kGauge, "Mean of meter ", mapped.pattern, {&meanName}, mean);
   }
}

void AddCounter(Exposition& out, const QueryResult& result, MappedPath& mapped,
                std::vector<Series>& scratch) {
   MapPath(result.metadata->GetName(), mapped);
   bool isCounter = result.metadata->GetType() == Metadata::TYPE_COUNTER;
   scratch.clear();
   scratch.push_back({out.SeriesName(mapped.name, mapped.labels), result.value.Get(), false});
   out.Add(mapped.name, isCounter ? kCounter : kGauge, isCounter ? "Counter " : "Gauge ",
           mapped.pattern, {&mapped.name}, scratch);
}

bool IsMeterField(Metadata::Type type) {
   return type >= Metadata::TYPE_METER_TOTAL && type <= Metadata::TYPE_METER_MEAN;
}

}  // namespace

void WritePrometheusText(Registry* registry, Writer* writer) {
   QueryResults results;
   registry->CollectAll(results);

   // Counters in name order; a meter takes the place of its first field.
   struct Item {
      const QueryResult* counter = nullptr;
      size_t meter = 0;  // index into meters
   };
   std::vector<Item> items;
   items.reserve(results.size());
   std::vector<MeterParts> meters;
   std::unordered_map<std::string_view, size_t> meterIndex;
   for (const QueryResult& result : results) {
      const std::string& name = result.metadata->GetName();
      Metadata::Type type = result.metadata->GetType();
      size_t slash = name.rfind('/');
      if (!IsMeterField(type) || slash == 0) {
         items.push_back({&result, 0});
         continue;
      }
      std::string_view base(name.data(), slash);
      auto [it, added] = meterIndex.try_emplace(base, meters.size());
      if (added) {
         meters.emplace_back();
         meters.back().path = std::string(base);
         items.push_back({nullptr, it->second});
      }
      meters[it->second].fields[type - Metadata::TYPE_METER_TOTAL] = result.value.Get();
   }

   Exposition exposition(results.size());
   MappedPath mapped;
   std::vector<Series> scratch;
   for (const Item& item : items) {
      if (item.counter) {
         AddCounter(exposition, *item.counter, mapped, scratch);
      } else {
         AddMeter(exposition, meters[item.meter], mapped);
      }
   }
   exposition.Write(writer);
}

}  // namespace Pelmora::PerfCounter
