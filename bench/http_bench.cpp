// HTTP messages against Boost.Beast: reading a typical 400-byte browser request header
// from memory (our reader runs its whole path: the read into the header area, the
// end-of-header scan and the parse into fields and cookies), and framing a small
// buffered response (status line, Date, a few fields, Content-Length, body).

#include <boost/beast/core.hpp>
#include <boost/beast/http.hpp>

#include <cstring>
#include <ctime>
#include <string>

#include "pelmora/pelmora.h"
#include "pelmora/system/stream.h"
#include "support/ratioMain.h"

using namespace Pelmora;
namespace beast = boost::beast;
namespace bhttp = boost::beast::http;

namespace {

const std::string kRequest =
   "GET /app/inventory/items?page=2&sort=name HTTP/1.1\r\n"
   "Host: manage.example.com:8443\r\n"
   "User-Agent: Mozilla/5.0 (X11; Linux x86_64; rv:128.0) Gecko/20100101 Firefox/128.0\r\n"
   "Accept: text/html,application/xhtml+xml,application/xml;q=0.9,*/*;q=0.8\r\n"
   "Accept-Language: en-US,en;q=0.5\r\n"
   "Accept-Encoding: gzip, deflate, br\r\n"
   "Referer: https://manage.example.com:8443/app/inventory\r\n"
   "Connection: keep-alive\r\n"
   "Cookie: norvex_soap_session=3f9a8c7e; theme=dark\r\n"
   "Upgrade-Insecure-Requests: 1\r\n"
   "\r\n";

// A stream over memory: reads hand out `input` from the start each time the request is
// rearmed; writes are counted. Completions run at once on the calling thread.
class MemoryStream : public virtual System::Stream, public System::WaitableObjectImpl {
public:
   explicit MemoryStream(const std::string& input) : _input(input) {}
   void Rewind() { _at = 0; }
   size_t Written() const { return _written; }

   int WaitWrite() override { return 0; }
   int WaitRead() override { return 0; }
   int TimedWaitWrite(long long) override { return 0; }
   int TimedWaitRead(long long) override { return 0; }
   bool HasWriteCompleted() override { return false; }
   bool HasReadCompleted() override { return false; }
   void SetReadTimeout(long long, Service::Logger::LogLevel, const char*) override {}
   void SetWriteTimeout(long long, Service::Logger::LogLevel, const char*) override {}
   void GetBindingInfo(const std::type_info&, Ref<System::BindingInfo>&, Ref<System::BindingInfo>&) override {}
   void CloseNoLock() override {}
   int Write(const char*, int length) override {
      _written += static_cast<size_t>(length);
      return length;
   }
   void AsyncWrite(const char* buffer, int length, const System::Functor<void, Stream*, Exception*>& callback) override {
      Write(buffer, length);
      callback(this, nullptr);
   }
   int Read(char* buffer, int length) override {
      size_t n = std::min(static_cast<size_t>(length), _input.size() - _at);
      std::memcpy(buffer, _input.data() + _at, n);
      _at += n;
      return static_cast<int>(n);
   }
   void AsyncRead(char* buffer, int length, const System::Functor<void, Stream*, Exception*, int>& callback) override {
      int n = Read(buffer, length);
      callback(this, nullptr, n);
   }
   void Close() override {}

private:
   std::string _input;
   size_t _at = 0;
   size_t _written = 0;
};

class BenchConnection : public virtual Http::HttpConnection, public ObjectImpl {
public:
   void GetClientCapabilities(Http::ClientCapabilities& out) override { out = Http::ClientCapabilities(); }
   long long GetMaxBufferedResponseBytes() override { return -1; }
   void ResponseCompleted(bool) override {}
};

void BM_ReadRequestHeader(benchmark::State& state) {
   Ref<MemoryStream> stream = new MemoryStream(kRequest);
   Ref<Http::Request> request;
   Http::CreateRequest(stream.Get(), request);
   bool ok = true;
   Http::Request::HeaderCallback done = [&](Http::Request*, Exception* error, bool got) { ok = ok && got && !error; };
   for (auto _ : state) {
      stream->Rewind();
      request->ResetStream(stream.Get());
      request->AsyncReadHeader(done);
      benchmark::DoNotOptimize(request->GetPath().size());
   }
   if (!ok || request->GetHeader().GetFields().size() != 9) state.SkipWithError("parse failed");
   state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kRequest.size()));
   state.counters["headers/s"] = benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
}

void BM_BeastRequestParser(benchmark::State& state) {
   bool ok = true;
   for (auto _ : state) {
      bhttp::request_parser<bhttp::empty_body> parser;
      beast::error_code error;
      parser.put(boost::asio::buffer(kRequest), error);
      ok = ok && !error && parser.is_header_done();
      benchmark::DoNotOptimize(parser.get().target().size());
   }
   if (!ok) state.SkipWithError("parse failed");
   state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kRequest.size()));
   state.counters["headers/s"] = benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
}

const std::string kBody = "<result><status>ok</status><count>42</count></result>\n";

void BM_FrameBufferedResponse(benchmark::State& state) {
   Ref<MemoryStream> stream = new MemoryStream("");
   Ref<BenchConnection> connection = new BenchConnection();
   Ref<Http::Response> response;
   Http::CreateResponse(connection.Get(), stream.Get(), response);
   for (auto _ : state) {
      response->Reset();
      response->GetHeader().SetContentType("text/xml", "utf-8");
      response->SetCacheResponse(false);
      response->Write(kBody.data(), static_cast<int>(kBody.size()));
      response->Complete();
   }
   benchmark::DoNotOptimize(stream->Written());
}

void BM_BeastSerializeResponse(benchmark::State& state) {
   std::string out;
   for (auto _ : state) {
      bhttp::response<bhttp::string_body> response{bhttp::status::ok, 11};
      char date[64];
      time_t now = time(nullptr);
      struct tm parts;
      gmtime_r(&now, &parts);
      strftime(date, sizeof date, "%a, %d %b %Y %H:%M:%S GMT", &parts);
      response.set(bhttp::field::date, date);
      response.set(bhttp::field::cache_control, "no-cache");
      response.set(bhttp::field::connection, "Keep-Alive");
      response.set(bhttp::field::content_type, "text/xml; charset=utf-8");
      response.body() = kBody;
      response.prepare_payload();
      bhttp::serializer<false, bhttp::string_body> serializer{response};
      beast::error_code error;
      out.clear();
      do {
         serializer.next(error, [&](beast::error_code&, const auto& buffers) {
            size_t n = 0;
            for (auto buffer : beast::buffers_range_ref(buffers)) {
               out.append(static_cast<const char*>(buffer.data()), buffer.size());
               n += buffer.size();
            }
            serializer.consume(n);
         });
      } while (!error && !serializer.is_done());
      benchmark::DoNotOptimize(out.size());
   }
}

}  // namespace

BENCHMARK(BM_ReadRequestHeader);
BENCHMARK(BM_BeastRequestParser);
BENCHMARK(BM_FrameBufferedResponse);
BENCHMARK(BM_BeastSerializeResponse);

int main(int argc, char** argv) {
   return PelmoraBench::RunWithRatios(argc, argv,
                                      {{"BM_ReadRequestHeader", "BM_BeastRequestParser"},
                                       {"BM_FrameBufferedResponse", "BM_BeastSerializeResponse"}});
}
