#pragma once
// A writer that keeps every Write as its own piece, so tests see how text was cut.

#include <string>
#include <vector>

#include "pelmora/io/readerWriter.h"
#include "pelmora/object/ref.h"

namespace Pelmora::TestSupport {

class PieceWriter : public virtual Writer, public ObjectImpl {
public:
   void Write(const char* data, int length) override { pieces.emplace_back(data, length); }
   void Close() override {}
   std::string Text() const {
      std::string text;
      for (const std::string& piece : pieces) text += piece;
      return text;
   }
   std::vector<std::string> pieces;
};

}  // namespace Pelmora::TestSupport
