#include "tools/pelmorad/managementApi.h"

#include <unistd.h>

#include <functional>
#include <list>
#include <map>

#include "pelmora/exception/exceptions.h"
#include "pelmora/perfCounter/registry.h"
#include "pelmora/service/app.h"
#include "pelmora/service/logger.h"
#include "pelmora/soap/envelope.h"
#include "pelmora/system/threadState.h"
#include "pelmora/xml/node.h"
#include "tools/pelmorad/daemon.h"
#include "tools/pelmorad/embedded.h"
#include "tools/pelmorad/statusApi.h"

namespace Pelmora::Daemon {

namespace {

// The address written into the WSDL as compiled in, replaced when it is served.
constexpr char kWsdlAddress[] = "http://127.0.0.1:8080/soap";
constexpr int kMaxLogLines = 10000;

bool EndsWith(const std::string& text, const std::string& tail) {
   return text.size() >= tail.size() && text.compare(text.size() - tail.size(), tail.size(), tail) == 0;
}

std::string EscapeXml(const std::string& text) {
   std::string out;
   for (char c : text) {
      switch (c) {
         case '&': out += "&amp;"; break;
         case '<': out += "&lt;"; break;
         case '>': out += "&gt;"; break;
         case '"': out += "&quot;"; break;
         case '\'': out += "&apos;"; break;
         default: out += c;
      }
   }
   return out;
}

std::string RequiredText(Xml::ElementNode* body, const char* name) {
   Xml::ElementNode* child = body->GetChildElementByTag(name);
   if (child == nullptr) throw Soap::InvalidRequestException(std::string("Missing element ") + name);
   return Xml::GetTextContent(child);
}

// Builds "<m:NameResponse xmlns:m=...>" and its unqualified children.
class Answer {
public:
   explicit Answer(const std::string& operation) {
      Xml::CreateElementNode("m", operation + "Response", _root);
      _root->DefineAttribute("xmlns:m", kManagementNamespace);
   }
   static Xml::ElementNode* Add(Xml::ElementNode* parent, const std::string& name, const std::string& text) {
      Ref<Xml::ElementNode> element;
      Xml::CreateElementNode(name, element);
      Ref<Xml::TextNode> content;
      Xml::CreateTextNode(text, content);
      element->AppendChild(content.Get());
      parent->AppendChild(element.Get());
      return element.Get();
   }
   Xml::ElementNode* Add(const std::string& name, const std::string& text) { return Add(_root.Get(), name, text); }
   Xml::ElementNode* AddGroup(const std::string& name) {
      Ref<Xml::ElementNode> element;
      Xml::CreateElementNode(name, element);
      _root->AppendChild(element.Get());
      return element.Get();
   }
   void Send(Soap::Reply* reply) { reply->WriteReply(_root.Get()); }

private:
   Ref<Xml::ElementNode> _root;
};

using Operation = std::function<void(Xml::ElementNode* body, Soap::Reply* reply)>;

class OperationHandler : public virtual Soap::BodyHandler, public ObjectImpl {
public:
   OperationHandler(std::string name, Operation operation)
       : _name(std::move(name)), _operation(std::move(operation)) {}
   void GetBodyHandlerInfo(Soap::BodyHandlerInfo& out) const override { out = {kManagementNamespace, _name}; }
   void HandleBody(Soap::SoapRequest*, Xml::ElementNode*, Xml::ElementNode* body, Soap::Reply* reply) override {
      _operation(body, reply);
   }

private:
   const std::string _name;
   const Operation _operation;
};

// Serves the compiled-in WSDL for "<path>?wsdl" with the address the client asked by;
// everything else goes to the SOAP service.
class WsdlFront : public virtual Http::RequestHandler, public ObjectImpl {
public:
   WsdlFront(Http::RequestHandler* soap, std::string path, std::string fallbackUrl)
       : _soap(soap), _path(std::move(path)), _fallbackUrl(std::move(fallbackUrl)) {}

   void HandleGet(Http::Request* request, Http::Response* response) override {
      if (request->GetPath() != _path + "?wsdl") return _soap->HandleGet(request, response);
      std::string text = GetManagementWsdl(Location(request));
      response->SetStatusCode(Http::ResponseCode::Ok);
      response->GetHeader().SetContentType("text/xml; charset=utf-8");
      response->SetContentLength(static_cast<long long>(text.size()));
      response->Write(text.data(), static_cast<int>(text.size()));
      response->Complete();
   }
   void HandlePost(Http::Request* request, Http::Response* response) override { _soap->HandlePost(request, response); }
   void HandleHead(Http::Request* request, Http::Response* response) override { _soap->HandleHead(request, response); }
   void HandlePut(Http::Request* request, Http::Response* response) override { _soap->HandlePut(request, response); }
   void HandleDelete(Http::Request* request, Http::Response* response) override {
      _soap->HandleDelete(request, response);
   }

private:
   // The Host the client sent (a proxy passes the public one on), when it looks like a
   // host and port; the daemon's own URL otherwise.
   std::string Location(Http::Request* request) const {
      std::string host, scheme = "http";
      const Http::RequestHeader& header = request->GetHeader();
      if (!header.GetField("Host", host) || host.empty() ||
          host.find_first_not_of("abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789.-:[]") !=
              std::string::npos)
         return _fallbackUrl + _path.substr(1);
      std::string forwarded;
      if (header.GetField("X-Forwarded-Proto", forwarded) && forwarded == "https") scheme = "https";
      return scheme + "://" + host + _path;
   }

   const Ref<Http::RequestHandler> _soap;
   const std::string _path;
   const std::string _fallbackUrl;
};

void AddStatus(Answer& answer, Daemon* daemon, const std::string& instanceId) {
   Ref<Service::AppInfo> info = Service::GetApp()->GetAppInfo();
   answer.Add("name", info ? info->GetName() : "pelmorad");
   answer.Add("version", info ? info->GetVersion() : "");
   answer.Add("instanceId", instanceId);
   answer.Add("pid", std::to_string(getpid()));
   answer.Add("url", daemon->GetUrl());
   answer.Add("configFile", daemon->GetConfigFile());
   answer.Add("uptimeSeconds", std::to_string(daemon->GetUptimeSeconds()));
   answer.Add("state", daemon->IsStopping() ? "stopping" : "running");
   Http::HttpSvc* svc = daemon->GetHttpService();
   answer.Add("connections", std::to_string(svc ? svc->GetConnectionCount() : 0));
}

void AddCounters(Answer& answer, const std::string& pattern) {
   PerfCounter::QueryResults results;
   try {
      QueryCounters(pattern, results);
   } catch (const InvalidArgumentException& e) {
      throw Soap::InvalidRequestException("Invalid regular expression: " + e.GetMessage());
   }
   for (const PerfCounter::QueryResult& result : results) {
      Xml::ElementNode* counter = answer.AddGroup("counter");
      Answer::Add(counter, "name", result.metadata->GetName());
      Answer::Add(counter, "type", PerfCounter::Metadata::TypeName(result.metadata->GetType()));
      Answer::Add(counter, "value", std::to_string(result.value.Get()));
   }
}

void AddThreadStates(Answer& answer) {
   std::map<long long, std::list<std::string>> states;
   System::CopyThreadStates(states, 3);
   for (const auto& [thread, messages] : states) {
      if (messages.empty()) continue;
      Xml::ElementNode* entry = answer.AddGroup("thread");
      Answer::Add(entry, "id", std::to_string(thread));
      for (const std::string& message : messages) Answer::Add(entry, "state", message);
   }
}

int ParseLineCount(const std::string& text) {
   char* end = nullptr;
   long value = std::strtol(text.c_str(), &end, 10);
   if (text.empty() || *end != '\0' || value < 0)
      throw Soap::InvalidRequestException("lines must be a number of 0 or more, not '" + text + "'");
   return static_cast<int>(std::min<long>(value, kMaxLogLines));
}

}  // namespace

std::string GetManagementWsdl(const std::string& location) {
   const EmbeddedFile* file = FindEmbeddedFile("management.wsdl");
   if (file == nullptr) throw NotFoundException("The management WSDL is not compiled in");
   std::string text(reinterpret_cast<const char*>(file->data), file->size);
   const std::string marker = std::string("location=\"") + kWsdlAddress + "\"";
   size_t at = text.find(marker);
   if (at != std::string::npos) text.replace(at, marker.size(), "location=\"" + EscapeXml(location) + "\"");
   return text;
}

ManagementApi::ManagementApi(Daemon* daemon) : _daemon(daemon) {}

ManagementApi::~ManagementApi() { Stop(); }

const std::string& ManagementApi::GetInstanceId() const { return _soap->GetInstanceId(); }

void ManagementApi::Start() {
   Ref<Service::Config> config = Service::GetApp()->GetConfig();
   Ref<Service::Config::View> view;
   config->GetView("pelmora/soap", view);
   _path = "/soap";
   view->Get("path", &_path);
   Http::HttpSvc* http = _daemon->GetHttpService();
   Soap::CreateSoapSvcOnHttp(nullptr, http, view.Get(), _soap);

   Ref<Soap::BodyHandlerMap> map;
   Soap::CreateBodyHandlerMap(nullptr, kManagementNamespace, map);
   auto add = [&map](const char* name, Operation operation) {
      map->AddBodyHandler(new OperationHandler(name, std::move(operation)));
   };
   add("GetStatus", [this](Xml::ElementNode*, Soap::Reply* reply) {
      Answer answer("GetStatus");
      AddStatus(answer, _daemon, GetInstanceId());
      answer.Send(reply);
   });
   add("QueryCounters", [](Xml::ElementNode* body, Soap::Reply* reply) {
      Answer answer("QueryCounters");
      AddCounters(answer, RequiredText(body, "pattern"));
      answer.Send(reply);
   });
   add("GetConfig", [](Xml::ElementNode* body, Soap::Reply* reply) {
      std::string path = RequiredText(body, "path"), value;
      Ref<Service::Config::View> main;
      Service::GetApp()->GetConfig()->GetMainView(main);
      if (path.empty() || !main->Get(path, &value))
         throw Soap::InvalidRequestException("No configuration value at '" + path + "'");
      Answer answer("GetConfig");
      answer.Add("value", value);
      answer.Send(reply);
   });
   add("SetConfig", [this](Xml::ElementNode* body, Soap::Reply* reply) {
      std::string path = RequiredText(body, "path"), value = RequiredText(body, "value");
      SetConfig(path, value);
      Answer answer("SetConfig");
      answer.Add("file", _daemon->GetConfigFile());
      answer.Send(reply);
   });
   add("GetLogTail", [](Xml::ElementNode* body, Soap::Reply* reply) {
      int lines = ParseLineCount(RequiredText(body, "lines"));
      Answer answer("GetLogTail");
      for (const std::string& line : GetLogTail(lines)) answer.Add("line", line);
      answer.Send(reply);
   });
   add("GetThreadStates", [](Xml::ElementNode*, Soap::Reply* reply) {
      Answer answer("GetThreadStates");
      AddThreadStates(answer);
      answer.Send(reply);
   });
   add("Echo", [](Xml::ElementNode* body, Soap::Reply* reply) {
      Answer answer("Echo");
      answer.Add("text", RequiredText(body, "text"));
      answer.Send(reply);
   });
   _soap->SetSoapRequestHandler(map.Get());
   _soap->Start();
   // The SOAP service registered its own handler at the path; the front replaces it.
   Ref<Http::RequestHandler> soapHandler;
   _soap->GetHttpRequestHandler(soapHandler);
   _handler = new WsdlFront(soapHandler.Get(), _path, _daemon->GetUrl());
   http->AddRequestHandler(_path, _handler.Get());
   _started = true;
}

void ManagementApi::Stop() {
   if (!_started) return;
   _started = false;
   _soap->Stop();
}

void ManagementApi::SetConfig(const std::string& path, const std::string& value) {
   const std::string& file = _daemon->GetConfigFile();
   if (file.empty())
      throw Soap::InvalidRequestException("No configuration file was given with --config: nothing to write to");
   if (EndsWith(file, ".gz") && !EndsWith(file, ".xml.gz"))
      throw Soap::InvalidRequestException("Cannot write back the compressed file " + file +
                                          ": only XML files are written compressed");
   if (path.empty()) throw Soap::InvalidRequestException("Empty configuration path");
   std::lock_guard<std::mutex> lock(_setMutex);
   Ref<Service::Config> config = Service::GetApp()->GetConfig();
   Ref<Service::Config::View> main;
   config->GetMainView(main);
   const bool had = main->IsSet(path);
   std::string old;
   if (had) main->Get(path, &old);
   auto restore = [&] {
      if (had) {
         main->Set(path, old);
      } else {
         main->Unset(path);
      }
   };
   try {
      main->Set(path, value);
   } catch (const InvalidArgumentException& e) {
      throw Soap::InvalidRequestException("Cannot set '" + path + "': " + e.GetMessage());
   }
   try {
      config->Flush();
   } catch (const InvalidArgumentException& e) {
      restore();
      throw Soap::InvalidRequestException("Cannot write '" + path + "' to " + file + ": " + e.GetMessage());
   } catch (...) {
      restore();
      throw;
   }
}

}  // namespace Pelmora::Daemon
