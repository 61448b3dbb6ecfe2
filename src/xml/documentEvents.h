#pragma once
// The standard document handler's events in the form expat delivers them. When its handler
// is the standard one, the parser calls these instead of the XMLHandler events: names stay
// C strings, an end tag's name is not made at all, and a call needs no adjustment for the
// handler interface's virtual base. They throw as the XMLHandler events do.

namespace Pelmora::Xml {

class DocumentEvents {
public:
   virtual void StartElement(const char* name, int line, int column, const char** attributes) = 0;
   virtual void EndElement() = 0;
   virtual void Characters(const char* data, int length) = 0;
   virtual void Comment(const char* text) = 0;
   virtual void StartCData() = 0;
   virtual void EndCData() = 0;

protected:
   ~DocumentEvents() = default;
};

}  // namespace Pelmora::Xml
