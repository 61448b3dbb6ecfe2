#include <iostream>

#include <pelmora/pelmora.h>

int main() {
   Pelmora::Ref<Pelmora::StringWriter> writer;
   Pelmora::CreateStringWriter(writer);
   Pelmora::MessageFormatter::Print(writer.Get(), "consumer: %1 of %2", 3, 4);
   std::cout << writer->GetString() << "\n";
   return 0;
}
