// The body handler map: parses the envelope and calls the handler registered for the
// body element's namespace and local name.

#include <map>
#include <mutex>
#include <utility>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/logMacros.h"
#include "src/soap/soapLog.h"
#include "pelmora/soap/soapSvc.h"

namespace Pelmora::Soap {

namespace {

using Key = std::pair<std::string, std::string>;  // namespace URI, local name

class BodyHandlerMapImpl final : public virtual BodyHandlerMap, public ObjectImpl {
public:
   BodyHandlerMapImpl(Service::Logger* logger, std::string defaultVersionUri)
       : _logger(OrSoapLogger(logger)), _defaultUri(std::move(defaultVersionUri)) {}

   void AddBodyHandler(BodyHandler* handler) override {
      BodyHandlerInfo info;
      handler->GetBodyHandlerInfo(info);
      Add(Key(info.uri, info.name), handler);
   }

   void AddDefaultVersionUriBodyHandler(BodyHandler* handler) override {
      BodyHandlerInfo info;
      handler->GetBodyHandlerInfo(info);
      Add(Key(_defaultUri, info.name), handler);
   }

   void RemoveBodyHandler(const BodyHandlerInfo& info) override {
      std::lock_guard<std::mutex> lock(_mutex);
      _handlers.erase(Key(info.uri, info.name));
   }

   bool LookupBodyHandler(const BodyHandlerInfo& info, Ref<BodyHandler>& out) override {
      std::lock_guard<std::mutex> lock(_mutex);
      auto found = _handlers.find(Key(info.uri, info.name));
      if (found == _handlers.end()) return false;
      out = found->second;
      return true;
   }

   void HandleRequest(SoapRequest* request, Reply* reply) override {
      Ref<Xml::ElementNode> header, body;
      try {
         ParseSoapBody(_logger.Get(), request, header, body);
      } catch (const InvalidRequestException& e) {
         PELMORA_LOG_INFO(_logger.Get(), "Client sent us an invalid SOAP request: %1", e.GetMessage());
         reply->WriteFault(kClientFault, e.GetMessage());
         return;
      }
      BodyHandlerInfo info;
      Xml::QName name;
      body->GetQName(name);
      info.uri = name.uri;
      info.name = name.localName;
      Ref<BodyHandler> handler;
      if (!LookupBodyHandler(info, handler)) {
         std::string text = "No handler for SOAP body element {" + info.uri + "}" + info.name;
         PELMORA_LOG_INFO(_logger.Get(), "%1", text);
         reply->WriteFault(kClientFault, text);
         return;
      }
      try {
         handler->HandleBody(request, header.Get(), body.Get(), reply);
      } catch (const InvalidRequestException& e) {
         PELMORA_LOG_INFO(_logger.Get(), "Client sent us an invalid SOAP request: %1", e.GetMessage());
         if (!reply->IsComplete()) reply->WriteFault(kClientFault, e.GetMessage());
      } catch (const Exception& e) {
         PELMORA_LOG_WARNING(_logger.Get(), "Exception while dispatching SOAP request: %1", e.GetMessage());
         if (!reply->IsComplete()) reply->WriteFault(kServerFault, e.GetMessage());
      }
      if (!reply->IsComplete()) {
         PELMORA_LOG_WARNING(_logger.Get(), "Body handler for {%1}%2 wrote no reply", info.uri, info.name);
         reply->WriteFault(kServerFault, "No reply for " + info.name);
      }
   }

private:
   void Add(const Key& key, BodyHandler* handler) {
      std::lock_guard<std::mutex> lock(_mutex);
      if (!_handlers.emplace(key, Ref<BodyHandler>(handler)).second)
         throw AlreadyExistsException("{" + key.first + "}" + key.second);
   }

   Ref<Service::Logger> _logger;
   const std::string _defaultUri;
   std::mutex _mutex;
   std::map<Key, Ref<BodyHandler>> _handlers;
};

}  // namespace

void CreateBodyHandlerMap(Service::Logger* logger, const std::string& defaultVersionUri, Ref<BodyHandlerMap>& out) {
   out = new BodyHandlerMapImpl(logger, defaultVersionUri);
}

}  // namespace Pelmora::Soap
