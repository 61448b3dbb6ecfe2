// The metrics handler behind a real HttpSvc: the export as curl and Python see it (sized
// and chunked), HEAD, refused verbs, the process registry, and a large export that
// promtool accepts.

#include <unistd.h>

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "pelmora/http/prometheusHandler.h"
#include "pelmora/io/writers.h"
#include "pelmora/perfCounter/prometheus.h"
#include "tests/support/httpClient.h"
#include "tests/support/netFixture.h"

namespace Pelmora::Http {
namespace {

using PerfCounter::Metadata;
using System::NetTesting::EnsurePool;
using Testing::RawClient;
using Testing::RunCommand;

// Counter i of a group reads base + i.
class IndexPublisher : public virtual PerfCounter::GroupPublisher, public ObjectImpl {
public:
   explicit IndexPublisher(long long base) : _base(base) {}
   void CollectValues(RefVector<Metadata>& metadata, std::vector<PerfCounter::Value>& values) override {
      for (size_t i = 0; i < metadata.size(); ++i) values.emplace_back(_base + static_cast<long long>(i));
   }

private:
   long long _base;
};

Ref<PerfCounter::RegistryItem> AddGroup(PerfCounter::Registry* registry, const std::vector<std::string>& names,
                                        Metadata::Type type, long long base = 0) {
   RefVector<Metadata> metadata;
   for (const auto& name : names) metadata.push_back(new Metadata(name, type));
   Ref<PerfCounter::RegistryItem> item;
   registry->RegisterGroup(metadata, new IndexPublisher(base), item);
   return item;
}

std::string Export(PerfCounter::Registry* registry) {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   PerfCounter::WritePrometheusText(registry, writer.Get());
   return writer->GetString();
}

std::string Body(const std::string& response) {
   size_t end = response.find("\r\n\r\n");
   return end == std::string::npos ? std::string() : response.substr(end + 4);
}

class PrometheusHandlerTest : public ::testing::Test {
protected:
   void SetUp() override {
      EnsurePool();
      PerfCounter::CreateCounterRegistry(_registry);
   }
   void TearDown() override {
      if (_svc) _svc->Stop();
      for (auto& item : _items) item->Unregister();
   }
   void Start(PerfCounter::Registry* registry) {
      Ref<System::ServerSocket> socket;
      System::CreateTcpServerSocket("127.0.0.1", 0, System::ServerSocketOptions(), socket);
      Ref<System::BindingInfo> local;
      socket->GetBindingInfo(local);
      _port = local->GetPort();
      Ref<Service::Config> config;
      Service::CreateScratchConfig(config);
      Ref<Service::Config::View> view;
      config->GetView("pelmora/http", view);
      CreateHttpSvc(socket.Get(), nullptr, view.Get(), _svc);
      Ref<RequestHandler> handler;
      CreatePrometheusRequestHandler(registry, handler);
      _svc->AddRequestHandler("/metrics", handler.Get());
      Ref<RequestHandler> fallback;
      CreatePrometheusRequestHandler(_registry.Get(), fallback);
      _svc->SetRequestHandler(fallback.Get());
      _svc->Start();
   }
   std::string Url(const std::string& path = "/metrics") {
      return "http://127.0.0.1:" + std::to_string(_port) + path;
   }

   Ref<PerfCounter::Registry> _registry;
   std::vector<Ref<PerfCounter::RegistryItem>> _items;
   Ref<HttpSvc> _svc;
   int _port = 0;
};

TEST_F(PrometheusHandlerTest, ServesTheExportSizedChunkedAndForHead) {
   _items.push_back(AddGroup(_registry.Get(), {"/Http/Requests", "/Http/Errors"}, Metadata::TYPE_COUNTER, 7));
   _items.push_back(AddGroup(_registry.Get(), {"/Pool/Threads"}, Metadata::TYPE_GAUGE, 4));
   Start(_registry.Get());
   std::string expected = Export(_registry.Get());
   ASSERT_NE(expected.find("Http_Requests 7\n"), std::string::npos) << expected;

   std::string out = RunCommand("curl -s -D - --max-time 5 " + Url());
   EXPECT_EQ(out.rfind("HTTP/1.1 200", 0), 0u) << out;
   EXPECT_NE(out.find("Content-Type: text/plain; version=0.0.4; charset=utf-8\r\n"), std::string::npos) << out;
   EXPECT_EQ(Body(out), expected);

   out = RunCommand("curl -s -D - --http1.0 --max-time 5 " + Url());
   EXPECT_NE(out.find("Content-Length: " + std::to_string(expected.size()) + "\r\n"), std::string::npos) << out;
   EXPECT_EQ(Body(out), expected);

   RawClient head(_port);
   head.Send("HEAD /metrics HTTP/1.1\r\nHost: x\r\n\r\n");
   out = head.ReadResponse(true);
   EXPECT_NE(out.find("Content-Length: " + std::to_string(expected.size()) + "\r\n"), std::string::npos) << out;
   // Nothing followed the header: the connection answers the next request at once.
   head.Send("GET /metrics HTTP/1.1\r\nHost: x\r\nConnection: close\r\n\r\n");
   out = head.ReadResponse();
   EXPECT_EQ(out.rfind("HTTP/1.1 200", 0), 0u) << out;
   EXPECT_NE(out.find("Pool_Threads 4"), std::string::npos) << out;
}

TEST_F(PrometheusHandlerTest, OtherVerbsAreRefusedWithAllow) {
   Start(_registry.Get());
   for (const char* verb : {"POST", "PUT", "DELETE"}) {
      std::string out = RunCommand(std::string("curl -s -D - --max-time 5 -X ") + verb + " -d x " + Url());
      EXPECT_EQ(out.rfind("HTTP/1.1 405", 0), 0u) << verb << ": " << out;
      EXPECT_NE(out.find("Allow: GET, HEAD\r\n"), std::string::npos) << verb << ": " << out;
   }
   // The refused request's body is skipped and the connection serves the next one.
   std::string script =
       "import http.client,sys\n"
       "c=http.client.HTTPConnection('127.0.0.1'," + std::to_string(_port) + ",timeout=5)\n"
       "c.request('POST','/metrics',body=b'y'*5000); r=c.getresponse(); r.read()\n"
       "sys.stdout.write(str(r.status)+' '+r.getheader('Allow')+'|')\n"
       "c.request('GET','/metrics'); r=c.getresponse(); r.read()\n"
       "sys.stdout.write(str(r.status)+' '+r.getheader('Content-Type'))\n";
   std::string path = ::testing::TempDir() + "prometheus_client.py";
   std::ofstream(path) << script;
   EXPECT_EQ(RunCommand("python3 " + path), "405 GET, HEAD|200 text/plain; version=0.0.4; charset=utf-8");
}

TEST_F(PrometheusHandlerTest, NullRegistryServesTheProcessRegistry) {
   std::string name = "/HandlerTest/Process" + std::to_string(::getpid());
   _items.push_back(AddGroup(PerfCounter::GetCounterRegistry(), {name}, Metadata::TYPE_GAUGE, 42));
   Start(nullptr);
   std::string out = RunCommand("curl -s --max-time 5 " + Url());
   EXPECT_NE(out.find("HandlerTest_Process" + std::to_string(::getpid()) + " 42\n"), std::string::npos) << out;
   // The private registry behind the default handler does not have it.
   out = RunCommand("curl -s --max-time 5 " + Url("/other"));
   EXPECT_EQ(out.find("HandlerTest_Process"), std::string::npos) << out;
}

TEST_F(PrometheusHandlerTest, TenThousandCountersPassPromtool) {
   if (std::system("command -v promtool > /dev/null 2>&1") != 0) GTEST_SKIP() << "promtool is not installed";
   std::vector<std::string> counters, gauges, meter;
   for (int i = 0; i < 5000; ++i) {
      counters.push_back("/Big/Service='s" + std::to_string(i % 50) + "'/Calls" + std::to_string(i / 50));
      gauges.push_back("/Big/Level" + std::to_string(i));
   }
   _items.push_back(AddGroup(_registry.Get(), counters, Metadata::TYPE_COUNTER));
   _items.push_back(AddGroup(_registry.Get(), gauges, Metadata::TYPE_GAUGE, 100));
   RefVector<Metadata> meterFields;
   const Metadata::Type fields[] = {Metadata::TYPE_METER_TOTAL, Metadata::TYPE_METER_NUM_SAMPLES,
                                    Metadata::TYPE_METER_MIN, Metadata::TYPE_METER_MAX, Metadata::TYPE_METER_MEAN};
   const char* fieldNames[] = {"Total", "Count", "Min", "Max", "Mean"};
   for (int i = 0; i < 5; ++i) meterFields.push_back(new Metadata(std::string("/Big/Latency/") + fieldNames[i], fields[i]));
   Ref<PerfCounter::RegistryItem> meterItem;
   _registry->RegisterGroup(meterFields, new IndexPublisher(3), meterItem);
   _items.push_back(meterItem);
   ASSERT_GE(_registry->GetCounterCount(), 10000);
   Start(_registry.Get());

   std::string file = ::testing::TempDir() + "metrics_" + std::to_string(::getpid()) + ".txt";
   std::string headers = RunCommand("curl -s -D - -o " + file + " --max-time 10 " + Url());
   EXPECT_NE(headers.find("Transfer-Encoding: chunked"), std::string::npos) << headers;
   std::ifstream in(file);
   std::string body((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
   EXPECT_EQ(body, Export(_registry.Get()));
   std::string check = "promtool check metrics < " + file + " 2>&1; echo exit=$?";
   std::string verdict = RunCommand(check);
   // exit 0: clean; 3: only naming advice (units, suffixes); 1: the text did not parse.
   EXPECT_TRUE(verdict.find("exit=0") != std::string::npos || verdict.find("exit=3") != std::string::npos)
       << verdict.substr(0, 2000);
   EXPECT_EQ(verdict.find("error"), std::string::npos) << verdict.substr(0, 2000);
   // The checker can fail: a body cut inside a label is refused.
   std::ofstream(file) << body.substr(0, body.find("Service=\"s1") + 10);
   EXPECT_NE(RunCommand(check).find("exit=1"), std::string::npos);
   std::remove(file.c_str());
}

}  // namespace
}  // namespace Pelmora::Http
