// Streams against plain asio in the same binary: loopback echo round trips of 64 bytes,
// 1 MiB bulk transfers over TCP, and 1 MiB bulk over TLS against asio::ssl. Both sides
// serve asynchronously (ours on the library's pool, the peer on its own io_context with
// as many threads) and the client waits synchronously. Bulk: the client sends 1 MiB,
// the server answers one byte once it has it all.

#include <unistd.h>

#include <utility>  // before asio: its coroutine header needs std::exchange

#include <boost/asio.hpp>
#include <boost/asio/ssl.hpp>

#include <atomic>
#include <cstdlib>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/pelmora.h"
#include "support/ratioMain.h"

using namespace Pelmora;
using namespace Pelmora::System;
namespace asio = boost::asio;
using Tcp = asio::ip::tcp;

namespace {

constexpr int kRoundTripBytes = 64;
constexpr int kBulkBytes = 1 << 20;
constexpr int kServerThreads = 4;

void EnsurePool() {
   static bool made = [] {
      Ref<ThreadPool> pool;
      CreateThreadPool(nullptr, pool);
      SetThreadPool(pool.Get());
      return true;
   }();
   (void)made;
}

struct Certificates {
   std::string dir = "/tmp/pelmora_net_bench_" + std::to_string(::getpid());
   std::string chain() const { return dir + "/server.pem"; }
   std::string key() const { return dir + "/server.key"; }
};

const Certificates& GetCertificates() {
   static Certificates certificates = [] {
      Certificates made;
      std::string command = "mkdir -p " + made.dir + " && cd " + made.dir +
                            " && openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes"
                            " -keyout server.key -out server.pem -days 2 -subj /CN=localhost"
                            " -addext subjectAltName=IP:127.0.0.1 >/dev/null 2>&1";
      if (std::system(command.c_str()) != 0) std::abort();
      return made;
   }();
   return certificates;
}

// --- ours ---------------------------------------------------------------------------

// Echoes, or (sink) answers one byte per kBulkBytes received, with callbacks on the pool.
class OurSession : public std::enable_shared_from_this<OurSession> {
public:
   OurSession(Stream* stream, bool sink) : _stream(stream), _sink(sink), _buffer(65536) {}
   void Start() { ReadMore(); }

private:
   void ReadMore() {
      auto self = shared_from_this();
      _stream->AsyncRead(_buffer.data(), static_cast<int>(_buffer.size()),
                         [self](Stream*, Exception* error, int n) { self->OnRead(error, n); });
   }
   void OnRead(Exception* error, int n) {
      if (error != nullptr || n == 0) {
         _stream->Close();
         return;
      }
      auto self = shared_from_this();
      if (!_sink) {
         _stream->AsyncWrite(_buffer.data(), n, [self](Stream*, Exception* e) {
            if (e == nullptr) self->ReadMore();
         });
         return;
      }
      _received += n;
      if (_received < kBulkBytes) {
         ReadMore();
         return;
      }
      _received -= kBulkBytes;
      _stream->AsyncWrite("k", 1, [self](Stream*, Exception* e) {
         if (e == nullptr) self->ReadMore();
      });
   }

   Ref<Stream> _stream;
   bool _sink;
   std::vector<char> _buffer;
   long long _received = 0;
};

class OurServer {
public:
   OurServer(bool sink, bool tls) : _sink(sink) {
      EnsurePool();
      if (tls) {
         SslServerOptions options;
         options.certificateChainFile = GetCertificates().chain();
         options.privateKeyFile = GetCertificates().key();
         CreateSslServerContext(options, _context);
         CreateSslServerSocket("127.0.0.1", 0, ServerSocketOptions(), _context.Get(), _server);
      } else {
         CreateTcpServerSocket("127.0.0.1", 0, ServerSocketOptions(), _server);
      }
      Ref<BindingInfo> local;
      _server->GetBindingInfo(local);
      port = local->GetPort();
      Accept();
   }
   ~OurServer() { _server->Close(); }
   int port = 0;

private:
   void Accept() {
      bool sink = _sink;
      _server->AsyncAccept([this, sink](ServerSocket*, Exception* error, Stream* stream) {
         if (error != nullptr) return;
         std::make_shared<OurSession>(stream, sink)->Start();
      });
   }
   bool _sink;
   Ref<SslContext> _context;
   Ref<ServerSocket> _server;
};

void ReadFully(Stream* stream, char* buffer, int length) {
   for (int got = 0; got < length;) {
      int n = stream->Read(buffer + got, length - got);
      if (n == 0) std::abort();
      got += n;
   }
}

// --- the asio peer ------------------------------------------------------------------

template <class Socket>
class PeerSession : public std::enable_shared_from_this<PeerSession<Socket>> {
public:
   PeerSession(Socket socket, bool sink) : _socket(std::move(socket)), _sink(sink), _buffer(65536) {}
   void Start() { ReadMore(); }
   Socket& Get() { return _socket; }

   void ReadMore() {
      auto self = this->shared_from_this();
      _socket.async_read_some(asio::buffer(_buffer), [self](boost::system::error_code error, std::size_t n) {
         if (error) return;
         self->OnRead(n);
      });
   }

private:
   void OnRead(std::size_t n) {
      auto self = this->shared_from_this();
      if (!_sink) {
         asio::async_write(_socket, asio::buffer(_buffer.data(), n),
                           [self](boost::system::error_code error, std::size_t) {
                              if (!error) self->ReadMore();
                           });
         return;
      }
      _received += static_cast<long long>(n);
      if (_received < kBulkBytes) {
         ReadMore();
         return;
      }
      _received -= kBulkBytes;
      asio::async_write(_socket, asio::buffer("k", 1), [self](boost::system::error_code error, std::size_t) {
         if (!error) self->ReadMore();
      });
   }

   Socket _socket;
   bool _sink;
   std::vector<char> _buffer;
   long long _received = 0;
};

class PeerServer {
public:
   PeerServer(bool sink, bool tls)
       : _sink(sink), _tls(tls), _acceptor(_io, Tcp::endpoint(asio::ip::make_address("127.0.0.1"), 0)),
         _ssl(asio::ssl::context::tls_server), _guard(asio::make_work_guard(_io)) {
      if (tls) {
         _ssl.use_certificate_chain_file(GetCertificates().chain());
         _ssl.use_private_key_file(GetCertificates().key(), asio::ssl::context::pem);
      }
      port = _acceptor.local_endpoint().port();
      Accept();
      for (int i = 0; i < kServerThreads; ++i) _threads.emplace_back([this] { _io.run(); });
   }
   ~PeerServer() {
      _guard.reset();
      _io.stop();
      for (std::thread& thread : _threads) thread.join();
   }
   int port = 0;

private:
   void Accept() {
      _acceptor.async_accept(asio::make_strand(_io), [this](boost::system::error_code error, Tcp::socket socket) {
         if (error) return;
         socket.set_option(Tcp::no_delay(true));
         if (_tls) {
            using SslSocket = asio::ssl::stream<Tcp::socket>;
            auto session = std::make_shared<PeerSession<SslSocket>>(SslSocket(std::move(socket), _ssl), _sink);
            session->Get().async_handshake(asio::ssl::stream_base::server,
                                           [session](boost::system::error_code e) {
                                              if (!e) session->Start();
                                           });
         } else {
            std::make_shared<PeerSession<Tcp::socket>>(std::move(socket), _sink)->Start();
         }
         Accept();
      });
   }

   bool _sink;
   bool _tls;
   asio::io_context _io;
   Tcp::acceptor _acceptor;
   asio::ssl::context _ssl;
   asio::executor_work_guard<asio::io_context::executor_type> _guard;
   std::vector<std::thread> _threads;
};

// --- benchmarks -----------------------------------------------------------------------

void BM_StreamRoundTrip(benchmark::State& state) {
   OurServer server(false, false);
   Ref<Stream> client;
   CreateTcpConnection("127.0.0.1", server.port, 5000000, client);
   char out[kRoundTripBytes] = {};
   char in[kRoundTripBytes];
   for (auto _ : state) {
      client->Write(out, kRoundTripBytes);
      ReadFully(client.Get(), in, kRoundTripBytes);
   }
   state.counters["round_trips_per_s"] = benchmark::Counter(state.iterations(), benchmark::Counter::kIsRate);
   client->Close();
}
BENCHMARK(BM_StreamRoundTrip)->UseRealTime()->MinTime(1.0);

void BM_AsioRoundTrip(benchmark::State& state) {
   PeerServer server(false, false);
   asio::io_context io;
   Tcp::socket client(io);
   client.connect(Tcp::endpoint(asio::ip::make_address("127.0.0.1"), static_cast<unsigned short>(server.port)));
   client.set_option(Tcp::no_delay(true));
   char out[kRoundTripBytes] = {};
   char in[kRoundTripBytes];
   for (auto _ : state) {
      asio::write(client, asio::buffer(out));
      asio::read(client, asio::buffer(in));
   }
   state.counters["round_trips_per_s"] = benchmark::Counter(state.iterations(), benchmark::Counter::kIsRate);
}
BENCHMARK(BM_AsioRoundTrip)->UseRealTime()->MinTime(1.0);

void OurBulk(benchmark::State& state, bool tls) {
   OurServer server(true, tls);
   Ref<Stream> client;
   Ref<SslContext> context;
   if (tls) {
      SslClientOptions options;
      options.caFile = GetCertificates().chain();
      CreateSslClientContext(options, context);
      CreateSslConnection("127.0.0.1", server.port, 5000000, context.Get(), client);
   } else {
      CreateTcpConnection("127.0.0.1", server.port, 5000000, client);
   }
   std::string data(kBulkBytes, 'b');
   char ack;
   for (auto _ : state) {
      client->Write(data.data(), kBulkBytes);
      ReadFully(client.Get(), &ack, 1);
   }
   state.SetBytesProcessed(state.iterations() * static_cast<long long>(kBulkBytes));
   client->Close();
}

template <class Socket>
void PeerBulkLoop(benchmark::State& state, Socket& client) {
   std::string data(kBulkBytes, 'b');
   char ack;
   for (auto _ : state) {
      asio::write(client, asio::buffer(data));
      asio::read(client, asio::buffer(&ack, 1));
   }
   state.SetBytesProcessed(state.iterations() * static_cast<long long>(kBulkBytes));
}

void BM_StreamBulk(benchmark::State& state) { OurBulk(state, false); }
BENCHMARK(BM_StreamBulk)->UseRealTime()->MinTime(1.0);

void BM_AsioBulk(benchmark::State& state) {
   PeerServer server(true, false);
   asio::io_context io;
   Tcp::socket client(io);
   client.connect(Tcp::endpoint(asio::ip::make_address("127.0.0.1"), static_cast<unsigned short>(server.port)));
   client.set_option(Tcp::no_delay(true));
   PeerBulkLoop(state, client);
}
BENCHMARK(BM_AsioBulk)->UseRealTime()->MinTime(1.0);

void BM_StreamTlsBulk(benchmark::State& state) { OurBulk(state, true); }
BENCHMARK(BM_StreamTlsBulk)->UseRealTime()->MinTime(1.0);

void BM_AsioTlsBulk(benchmark::State& state) {
   PeerServer server(true, true);
   asio::io_context io;
   asio::ssl::context context(asio::ssl::context::tls_client);
   context.load_verify_file(GetCertificates().chain());
   context.set_verify_mode(asio::ssl::verify_peer);
   asio::ssl::stream<Tcp::socket> client(io, context);
   client.lowest_layer().connect(
       Tcp::endpoint(asio::ip::make_address("127.0.0.1"), static_cast<unsigned short>(server.port)));
   client.lowest_layer().set_option(Tcp::no_delay(true));
   client.handshake(asio::ssl::stream_base::client);
   PeerBulkLoop(state, client);
}
BENCHMARK(BM_AsioTlsBulk)->UseRealTime()->MinTime(1.0);

}  // namespace

int main(int argc, char** argv) {
   return PelmoraBench::RunWithRatios(argc, argv,
                                      {{"BM_StreamRoundTrip/min_time:1.000/real_time",
                                        "BM_AsioRoundTrip/min_time:1.000/real_time"},
                                       {"BM_StreamBulk/min_time:1.000/real_time", "BM_AsioBulk/min_time:1.000/real_time"},
                                       {"BM_StreamTlsBulk/min_time:1.000/real_time",
                                        "BM_AsioTlsBulk/min_time:1.000/real_time"}});
}
