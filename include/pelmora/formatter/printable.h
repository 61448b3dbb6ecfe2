#pragma once
// A Printable value writes its own text when it stands as a message argument (an XML node
// writes its compact serialisation). It lets the formatter print types of higher layers
// without knowing them. Implementations must be thread-safe for const use.

#include "pelmora/io/readerWriter.h"
#include "pelmora/object/export.h"

namespace Pelmora {

class PELMORA_EXPORT Printable {
public:
   virtual void PrintTo(Writer* writer) const = 0;

protected:
   ~Printable() = default;
};

}  // namespace Pelmora
