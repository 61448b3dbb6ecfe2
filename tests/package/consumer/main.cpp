// Uses one thing of each family through the installed headers and library only, so a
// symbol missing from the exported surface fails to link or to run here.
#include <iostream>

#include <pelmora/pelmora.h>

using namespace Pelmora;

int main() {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   MessageFormatter::Print(writer.Get(), "consumer: %1 of %2", 3, 4);

   // Exceptions thrown inside the library are caught by their base type outside it.
   try {
      Ref<Service::Config> config;
      Service::CreateXmlFileConfig("/nonexistent/consumer.xml", 1024, 0, config);
      return 1;
   } catch (const Exception& e) {
      if (e.GetMessage().empty()) return 2;
   }

   Ref<Service::Config> config;
   Service::CreateScratchConfig(config);
   Ref<Service::Config::View> view;
   config->GetMainView(view);
   view->Set("consumer/answer", "42");
   std::string answer;
   if (!view->Get("consumer/answer", &answer) || answer != "42") return 3;

   // An XML node prints itself as a message argument.
   Ref<Xml::XMLParserPool::ParserLease> lease;
   Xml::GetXmlParserPool()->GetParserLease(lease);
   Ref<Object> parsed;
   lease->GetParser()->Parse("<a x='1'>text</a>", parsed);
   Ref<Xml::Document> document = dynamic_cast<Xml::Document*>(parsed.Get());
   if (!document) return 4;
   std::string xml = MessageFormatter::ASPrint("%1", document->GetFirstChild());
   if (xml != "<a x=\"1\">text</a>") return 5;

   Ref<System::Mutex> mutex;
   System::GetSystemFactory()->CreateMutex(mutex);
   {
      System::Synchronized lock(mutex.Get());
   }
   PELMORA_LOG_TRIVIA(Service::GetDefaultLogger(), "consumer %1", answer);

   std::cout << writer->GetString() << "\n";
   return 0;
}
