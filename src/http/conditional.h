#pragma once
// The request fields that make a file answer conditional or partial: If-None-Match lists
// and single byte ranges. Pure functions over the field text, so they can be fuzzed alone.

#include <string>

namespace Pelmora::Http {

// Whether an If-None-Match list names `tag` ("*" names every tag); weak tags compare by
// their opaque part.
bool TagListMatches(const std::string& list, const std::string& tag);

// A Range request reduced to what is served: the whole file, one byte range (`first` to
// `last`, both inside the file), or none that can be satisfied.
struct ByteRange {
   enum Kind { WHOLE, PART, UNSATISFIABLE } kind = WHOLE;
   long long first = 0;
   long long last = -1;
};

// Only "bytes=a-b", "bytes=a-" and "bytes=-n" are served as ranges. Several ranges get
// the whole file: one 200 answer costs the client less than a multipart body costs us,
// and clients accept it. A malformed field is ignored, as if absent.
ByteRange ParseRange(std::string value, long long size);

}  // namespace Pelmora::Http
