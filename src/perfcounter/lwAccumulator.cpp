// The light-weight accumulator kinds and the statistics key rule.

#include "pelmora/perfCounter/lwStats.h"

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/messageFormatter.h"
#include "src/perfcounter/perfLog.h"

namespace Pelmora::PerfCounter {

void LwAccumulator::CheckSameType(const LwAccumulator* source) const {
   if (!source) throw InvalidArgumentException();
   if (source->GetType() != GetType()) throw InvalidArgumentException(source->GetName());
}

void LwCounter::Sample(long long value) {
   _count = static_cast<long long>(static_cast<unsigned long long>(_count) +
                                   static_cast<unsigned long long>(value));
}

void LwCounter::Merge(LwAccumulator* source) {
   CheckSameType(source);
   Sample(source->GetTotal());
}

void LwCounter::GetValues(NamedValues& out) {
   out.emplace_back(new Metadata(GetName(), Metadata::TYPE_COUNTER), Value(_count));
}

void LwCounter::CreateEmpty(const std::string& name, Ref<LwAccumulator>& out) const {
   out = new LwCounter(name);
}

std::string LwCounter::Describe() const { return "count=" + std::to_string(_count); }

void LwMeterAccumulator::Merge(LwAccumulator* source) {
   CheckSameType(source);
   auto* meter = dynamic_cast<LwMeterAccumulator*>(source);
   if (!meter) throw InvalidArgumentException(source->GetName());
   _meter.Merge(&meter->_meter);
}

void LwMeterAccumulator::GetValues(NamedValues& out) {
   for (int c = 0; c < Meter::kCounterCount; ++c) {
      auto counter = static_cast<Meter::Counter>(c);
      out.emplace_back(new Metadata(GetName() + "/" + Meter::GetCounterName(counter),
                                    Meter::GetCounterType(counter)),
                       Value(_meter.Get(counter)));
   }
}

void LwMeterAccumulator::ReadValues(std::vector<Value>& out) const {
   for (int c = 0; c < Meter::kCounterCount; ++c) {
      out.emplace_back(_meter.Get(static_cast<Meter::Counter>(c)));
   }
}

void LwMeterAccumulator::CreateEmpty(const std::string& name, Ref<LwAccumulator>& out) const {
   out = new LwMeterAccumulator(name);
}

std::string LwMeterAccumulator::Describe() const {
   // The meter's text without its leading "Meter ".
   return _meter.ToString().substr(6);
}

LwHistoryMeterAccumulator::LwHistoryMeterAccumulator(std::string name, int historySize)
   : LwMeterAccumulator(std::move(name)) {
   if (historySize < 1) throw InvalidArgumentException(std::to_string(historySize));
   _ring.resize(static_cast<size_t>(historySize));
}

void LwHistoryMeterAccumulator::Remember(long long value) {
   _ring[_next] = value;
   _next = (_next + 1) % _ring.size();
   if (_filled < _ring.size()) ++_filled;
}

void LwHistoryMeterAccumulator::Sample(long long value) {
   _meter.Sample(value);
   Remember(value);
}

void LwHistoryMeterAccumulator::Merge(LwAccumulator* source) {
   CheckSameType(source);
   auto* history = dynamic_cast<LwHistoryMeterAccumulator*>(source);
   if (!history) throw InvalidArgumentException(source->GetName());
   _meter.Merge(&history->_meter);
   std::vector<long long> samples;
   history->GetHistory(samples);
   for (long long value : samples) Remember(value);
}

void LwHistoryMeterAccumulator::Reset() {
   _meter.Reset();
   _next = 0;
   _filled = 0;
}

void LwHistoryMeterAccumulator::CreateEmpty(const std::string& name,
                                            Ref<LwAccumulator>& out) const {
   out = new LwHistoryMeterAccumulator(name, GetHistorySize());
}

void LwHistoryMeterAccumulator::GetHistory(std::vector<long long>& out) const {
   size_t start = (_next + _ring.size() - _filled) % _ring.size();
   for (size_t i = 0; i < _filled; ++i) out.push_back(_ring[(start + i) % _ring.size()]);
}

std::string LwHistoryMeterAccumulator::Describe() const {
   std::string text = LwMeterAccumulator::Describe() + " history=[";
   std::vector<long long> samples;
   GetHistory(samples);
   for (size_t i = 0; i < samples.size(); ++i) {
      if (i) text += ",";
      text += std::to_string(samples[i]);
   }
   return text + "]";
}

namespace {

bool IsUpper(char c) { return c >= 'A' && c <= 'Z'; }

bool IsWellFormedKey(const std::string& key) {
   if (key.empty() || !IsUpper(key.front())) return false;
   if (key.back() == '/' || key.back() == '=') return false;
   bool equalsInSegment = false;
   for (size_t i = 0; i < key.size(); ++i) {
      if (key[i] == '/') {
         // Also rules out "//": the next character must be a letter.
         if (i + 1 >= key.size() || !IsUpper(key[i + 1])) return false;
         equalsInSegment = false;
      } else if (key[i] == '=') {
         if (equalsInSegment || i + 1 >= key.size() || key[i + 1] != '\'') return false;
         equalsInSegment = true;
      }
   }
   return true;
}

}  // namespace

bool ValidateStatsScope(const std::string& key) {
   if (IsWellFormedKey(key)) return true;
   Internal::LogText(Internal::kLogError,
                     MessageFormatter::ASPrint("[ValidateStatsScope] Found an invalid key: %1", key));
   return false;
}

}  // namespace Pelmora::PerfCounter
