#include <gtest/gtest.h>
#include <unistd.h>

#include "pelmora/exception/exceptions.h"
#include "src/soap/soapImpl.h"

namespace Pelmora::Soap {
namespace {

// A pipe whose read end gives back what a reply wrote.
class Pipe {
public:
   Pipe() { EXPECT_EQ(::pipe(_fds), 0); }
   ~Pipe() {
      ::close(_fds[0]);
      if (_fds[1] >= 0) ::close(_fds[1]);
   }
   int WriteEnd() const { return _fds[1]; }
   std::string Drain() {
      ::close(_fds[1]);
      _fds[1] = -1;
      std::string text;
      char piece[4096];
      for (ssize_t n; (n = ::read(_fds[0], piece, sizeof piece)) > 0;) text.append(piece, static_cast<size_t>(n));
      return text;
   }

private:
   int _fds[2];
};

constexpr char kHead[] =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<soapenv:Envelope\n"
    " xmlns:soapenc=\"http://schemas.xmlsoap.org/soap/encoding/\"\n"
    " xmlns:soapenv=\"http://schemas.xmlsoap.org/soap/envelope/\"\n"
    " xmlns:xsd=\"http://www.w3.org/2001/XMLSchema\"\n"
    " xmlns:xsi=\"http://www.w3.org/2001/XMLSchema-instance\">\n<soapenv:Body>\n";
constexpr char kTail[] = "\n</soapenv:Body>\n</soapenv:Envelope>";

TEST(ReplyTest, StdioReplyWritesTheEnvelopeAloneOnce) {
   Pipe pipe;
   Ref<StdioReply> reply(new StdioReply(nullptr, pipe.WriteEnd()));
   Ref<Xml::ElementNode> body;
   Xml::CreateElementNode("ok", body);
   reply->WriteReply(body.Get());
   EXPECT_TRUE(reply->IsComplete());
   EXPECT_FALSE(reply->WasFault());
   EXPECT_THROW(reply->WriteReply(body.Get()), InvalidStateException);
   EXPECT_THROW(reply->WriteFault(kServerFault, "late"), InvalidStateException);
   EXPECT_EQ(pipe.Drain(), std::string(kHead) + "<ok/>" + kTail);
}

TEST(ReplyTest, FaultDetailContentIsMovedIntoTheFault) {
   Pipe pipe;
   Ref<StdioReply> reply(new StdioReply(nullptr, pipe.WriteEnd()));
   Ref<Xml::ElementNode> holder, item;
   Xml::CreateElementNode("holder", holder);
   Xml::CreateElementNode("reason", item);
   holder->AppendChild(item.Get());
   reply->WriteFault(kClientFault, "no", "me", holder.Get());
   EXPECT_TRUE(reply->WasFault());
   EXPECT_EQ(holder->GetFirstChild(), nullptr);
   EXPECT_EQ(pipe.Drain(), std::string(kHead) +
                               "<soapenv:Fault><faultcode>ClientFaultCode</faultcode><faultstring>no</faultstring>"
                               "<faultactor>me</faultactor><detail><reason/></detail></soapenv:Fault>" +
                               kTail);
}

TEST(ReplyTest, CgiReplyWritesStatusHeadersAndBody) {
   {
      Pipe pipe;
      Ref<CgiReply> reply(new CgiReply(nullptr, pipe.WriteEnd()));
      Ref<Xml::ElementNode> body;
      Xml::CreateElementNode("ok", body);
      reply->WriteReply(body.Get());
      std::string envelope = std::string(kHead) + "<ok/>" + kTail;
      EXPECT_EQ(pipe.Drain(), "Status: 200 OK\r\nContent-Length: " + std::to_string(envelope.size()) +
                                  "\r\nContent-Type: text/xml; charset=utf-8\r\n\r\n" + envelope);
   }
   Pipe pipe;
   Ref<CgiReply> reply(new CgiReply(nullptr, pipe.WriteEnd()));
   reply->WriteFault(kServerFault, "broken");
   EXPECT_TRUE(reply->WasFault());
   std::string text = pipe.Drain();
   EXPECT_EQ(text.rfind("Status: 500 Internal Server Error\r\n", 0), 0u) << text;
   EXPECT_NE(text.find("<faultcode>ServerFaultCode</faultcode>"), std::string::npos);
}

TEST(ReplyTest, AWriteToAClosedPipeFailsAndCompletesTheReply) {
   int fds[2];
   ASSERT_EQ(::pipe(fds), 0);
   ::close(fds[0]);
   Ref<StdioReply> reply(new StdioReply(nullptr, fds[1]));
   // SIGPIPE is ignored by the test main or turned into EPIPE here.
   signal(SIGPIPE, SIG_IGN);
   EXPECT_THROW(reply->WriteReply(nullptr), SystemException);
   EXPECT_TRUE(reply->IsComplete());
   ::close(fds[1]);
}

}  // namespace
}  // namespace Pelmora::Soap
