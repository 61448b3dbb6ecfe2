#pragma once
// Just enough JSON output for the status endpoints: values are appended to a string.

#include <string>
#include <string_view>

namespace Pelmora::Daemon {

// Appends `text` as a JSON string. Bytes that are not valid UTF-8 (a log line cut inside
// a character) become U+FFFD, so that every client can parse the answer.
void AppendJsonString(std::string& out, std::string_view text);

// Builds objects and arrays, placing the commas.
class JsonWriter {
public:
   JsonWriter& BeginObject() { return Open('{'); }
   JsonWriter& EndObject() { return Close('}'); }
   JsonWriter& BeginArray() { return Open('['); }
   JsonWriter& EndArray() { return Close(']'); }
   // The name of the next member of an object.
   JsonWriter& Key(std::string_view name);
   JsonWriter& String(std::string_view value);
   JsonWriter& Number(long long value);
   JsonWriter& Number(double value);
   JsonWriter& Bool(bool value);
   const std::string& Text() const { return _out; }

private:
   JsonWriter& Open(char bracket);
   JsonWriter& Close(char bracket);
   void Separate();

   std::string _out;
   bool _first = true;   // no value yet at this level
   bool _afterKey = false;
};

}  // namespace Pelmora::Daemon
