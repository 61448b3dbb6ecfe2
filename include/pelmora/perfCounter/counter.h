#pragma once
// The pieces every counter is made of: Metadata names and types one counter, Value carries
// one reading, and publishers supply readings when a query asks. Metadata and Value are
// immutable once built and safe to share; publishers are called from any thread that runs
// a query, under the registry's read lock, and must be thread-safe themselves.

#include <string>
#include <vector>

#include "pelmora/object/export.h"
#include "pelmora/object/containers.h"
#include "pelmora/object/ref.h"

namespace Pelmora::PerfCounter {

// One counter reading: a signed 64-bit number.
class PELMORA_EXPORT Value {
public:
   constexpr Value() = default;
   constexpr explicit Value(long long value) : _value(value) {}
   constexpr long long Get() const { return _value; }
   void Set(long long value) { _value = value; }
   friend constexpr bool operator==(Value a, Value b) { return a._value == b._value; }

private:
   long long _value = 0;
};

// The description of one counter: its path name and what kind of number it carries.
class PELMORA_EXPORT Metadata : public ObjectImpl {
public:
   enum Type {
      // A count that only grows while the process runs.
      TYPE_COUNTER = 1,
      // A level that goes up and down.
      TYPE_GAUGE = 2,
      // The five fields of a meter, in the order of Meter::Counter.
      TYPE_METER_TOTAL = 3,
      TYPE_METER_NUM_SAMPLES = 4,
      TYPE_METER_MIN = 5,
      TYPE_METER_MAX = 6,
      TYPE_METER_MEAN = 7,
   };

   Metadata(std::string name, Type type) : _name(std::move(name)), _type(type) {}

   const std::string& GetName() const { return _name; }
   Type GetType() const { return _type; }
   // The object text followed by " _name=" and the name, then " _type=" and the type.
   std::string ToString() const override;

   static const char* TypeName(Type type);

private:
   const std::string _name;
   const Type _type;
};

// Supplies the value of one registered counter.
class PELMORA_EXPORT Publisher : public virtual Object {
public:
   virtual void GetValue(Metadata* metadata, Value& out) = 0;
};

// Supplies the values of a group registered together, in one call.
class PELMORA_EXPORT GroupPublisher : public virtual Object {
public:
   // `metadata` is the group exactly as registered; `values` receives one value per
   // entry, in the same order (it is cleared first).
   virtual void CollectValues(RefVector<Metadata>& metadata, std::vector<Value>& values) = 0;
};

// Lets a single-counter Publisher stand where a group is expected: one GetValue per counter.
class PELMORA_EXPORT SingleGroupPublisher : public virtual GroupPublisher, public ObjectImpl {
public:
   explicit SingleGroupPublisher(Publisher* publisher) : _publisher(publisher) {}
   void CollectValues(RefVector<Metadata>& metadata, std::vector<Value>& values) override;
   Publisher* GetPublisher() const { return _publisher.Get(); }

private:
   const Ref<Publisher> _publisher;
};

}  // namespace Pelmora::PerfCounter
