// A writer that fans every piece out to two targets, e.g. a log file and a console.

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/writers.h"

namespace Pelmora {

class DoubleWriterImpl : public virtual Writer, public ObjectImpl {
public:
   DoubleWriterImpl(Writer* first, Writer* second) : _first(first), _second(second) {}

   void Write(const char* data, int length) override {
      if (length < 0) throw InvalidArgumentException("length");
      _first->Write(data, length);
      _second->Write(data, length);
   }

   void Flush() override {
      _first->Flush();
      _second->Flush();
   }

   void Close() override {
      _first->Close();
      _second->Close();
   }

private:
   Ref<Writer> _first;
   Ref<Writer> _second;
};

void CreateDoubleWriter(Writer* first, Writer* second, Ref<Writer>& out) {
   if (!first) throw InvalidArgumentException("first");
   if (!second) throw InvalidArgumentException("second");
   out = new DoubleWriterImpl(first, second);
}

}  // namespace Pelmora
