// The incoming call: its body, capped, from an HTTP request or a Reader, and its fields.

#include "pelmora/exception/panic.h"
#include "src/soap/soapImpl.h"
#include "src/soap/soapLog.h"

namespace Pelmora::Soap {

SoapRequestImpl::SoapRequestImpl(Service::Logger* logger, Http::Request* request, Fields fields, long long maxBytes)
    : _logger(OrSoapLogger(logger)), _request(request), _fields(std::move(fields)), _maxBytes(maxBytes) {}

SoapRequestImpl::SoapRequestImpl(Service::Logger* logger, Reader* source, Fields fields, long long maxBytes)
    : _logger(OrSoapLogger(logger)), _source(source), _fields(std::move(fields)), _maxBytes(maxBytes) {}

int SoapRequestImpl::Account(int n) {
   if (n <= 0) {
      _ended = true;
      return -1;
   }
   _bytesRead += n;
   if (_maxBytes >= 0 && _bytesRead > _maxBytes)
      throw InvalidRequestException("SOAP request exceeds " + std::to_string(_maxBytes) + " bytes");
   return n;
}

int SoapRequestImpl::Read(char* buffer, int length) {
   if (_ended || length <= 0) return _ended ? -1 : 0;
   // Never more than one byte past the cap is asked for: enough to see it passed.
   if (_maxBytes >= 0 && length > _maxBytes - _bytesRead + 1)
      length = static_cast<int>(_maxBytes - _bytesRead + 1);
   int n = _request ? _request->Read(buffer, length) : _source->Read(buffer, length);
   return Account(n);
}

void SoapRequestImpl::Close() {
   if (_request) _request->Close();
   if (_source) _source->Close();
}

void SoapRequestImpl::AsyncRead(char* buffer, int length, const ReadCallback& callback) {
   PELMORA_VERIFY(_asyncReadFunctor.IsNull());
   _asyncReadFunctor.callback = callback;
   Ref<SoapRequestImpl> self(this);
   // Hands the outcome over after the slot is free again, so the callback may read on.
   auto finish = [self](Exception* error, int n) {
      ReadCallback done = std::move(self->_asyncReadFunctor.callback);
      self->_asyncReadFunctor.callback.Reset();
      done(self.Get(), error, n);
   };
   if (_ended) return finish(nullptr, -1);
   if (_maxBytes >= 0 && length > _maxBytes - _bytesRead + 1)
      length = static_cast<int>(_maxBytes - _bytesRead + 1);
   if (!_request) {
      int n;
      try {
         n = Account(_source->Read(buffer, length));
      } catch (const Exception& e) {
         std::unique_ptr<Exception> copy(e.Clone());
         return finish(copy.get(), 0);
      }
      return finish(nullptr, n);
   }
   _request->AsyncRead(buffer, static_cast<unsigned int>(length), [self, finish](Http::Request*, Exception* error, int n) {
      if (error != nullptr) return finish(error, 0);
      int placed;
      try {
         placed = self->Account(n);
      } catch (const Exception& e) {
         std::unique_ptr<Exception> copy(e.Clone());
         return finish(copy.get(), 0);
      }
      finish(nullptr, placed);
   });
}

bool SoapRequestImpl::GetSoapAction(std::string& out) const {
   if (!_fields.hasSoapAction) return false;
   out = _fields.soapAction;
   return true;
}

bool SoapRequestImpl::GetUserAgent(std::string& out) const {
   if (!_fields.hasUserAgent) return false;
   out = _fields.userAgent;
   return true;
}

bool SoapRequestImpl::GetNorvexClient(std::string& out) const {
   if (!_fields.hasClient) return false;
   out = _fields.client;
   return true;
}

bool SoapRequestImpl::GetSession(Ref<Http::Session>& out) const {
   out = _fields.session;
   return static_cast<bool>(out);
}

}  // namespace Pelmora::Soap
