// The journal header and the eight entries: their byte layout, checks and printing.

#include <cstring>

#include "pelmora/exception/panic.h"
#include "pelmora/service/journal.h"

namespace Pelmora::Service {

namespace {

const char kInvalidEntry[] = "Serializing Invalid Journal Entry";
const char kTooSmall[] = "Buffer is too small to have a full record. Journal might be corrupt";
const char kUnexpected[] = "Unexpected character found in the header. Perhaps corrupt journal";

// Reads a little-endian 32-bit value whatever the host order.
uint32_t ReadU32(const char* p) {
   const auto* b = reinterpret_cast<const unsigned char*>(p);
   return uint32_t(b[0]) | uint32_t(b[1]) << 8 | uint32_t(b[2]) << 16 | uint32_t(b[3]) << 24;
}

void PutU32(char* p, uint32_t value) {
   for (int i = 0; i < 4; ++i) p[i] = static_cast<char>(value >> (8 * i));
}

const char* OpName(uint32_t op) {
   switch (op) {
      case kJrnlOpBegin: return "Begin";
      case kJrnlOpEnd: return "End";
      case kJrnlOpUndoFormer: return "UndoFormer";
      case kJrnlOpDir: return "Dir";
      case kJrnlOpFile: return "File";
      case kJrnlOpIntField: return "IntField";
      case kJrnlOpStringField: return "StringField";
      case kJrnlOpLongField: return "LongField";
      default: return "Unknown";
   }
}

// Printable form of a path or value: control bytes escaped so that one entry stays one line.
std::string Quote(const std::string& text) {
   std::string out = "\"";
   for (unsigned char c : text) {
      if (c == '"' || c == '\\') {
         out += '\\';
         out += static_cast<char>(c);
      } else if (c < 0x20 || c == 0x7f) {
         static const char digits[] = "0123456789abcdef";
         out += "\\x";
         out += digits[c >> 4];
         out += digits[c & 15];
      } else {
         out += static_cast<char>(c);
      }
   }
   return out + "\"";
}

bool ReadBool(const char* buffer, unsigned int length, unsigned int& offset) {
   char flag = 0;
   BaseJrnlEntry::DeserializePrimitive(buffer, length, offset, &flag, 1);
   if (flag != 0 && flag != 1) throw JrnlException(kTooSmall);
   return flag == 1;
}

template <class T>
T ReadInt(const char* buffer, unsigned int length, unsigned int& offset) {
   unsigned char bytes[sizeof(T)];
   BaseJrnlEntry::DeserializePrimitive(buffer, length, offset, bytes, sizeof(T));
   uint64_t value = 0;
   for (size_t i = 0; i < sizeof(T); ++i) value |= uint64_t(bytes[i]) << (8 * i);
   return static_cast<T>(value);
}

template <class T>
int WriteInt(Writer* writer, T value) {
   unsigned char bytes[sizeof(T)];
   auto u = static_cast<uint64_t>(value);
   for (size_t i = 0; i < sizeof(T); ++i) bytes[i] = static_cast<unsigned char>(u >> (8 * i));
   return BaseJrnlEntry::SerializePrimitive(writer, bytes, sizeof(T));
}

}  // namespace

int BaseJrnlEntry::SerializePrimitive(Writer* writer, const void* value, unsigned int size) {
   PELMORA_VERIFY(writer != NULL);
   writer->Write(static_cast<const char*>(value), static_cast<int>(size));
   return static_cast<int>(size);
}

int BaseJrnlEntry::SerializeString(Writer* writer, const std::string& value) {
   uint32_t strLen = static_cast<uint32_t>(value.size()) + 1;
   int n = WriteInt(writer, strLen);
   return n + SerializePrimitive(writer, value.c_str(), strLen);
}

void BaseJrnlEntry::DeserializePrimitive(const char* buffer, unsigned int length, unsigned int& offset,
                                         void* value, unsigned int size) {
   if (offset > length || length - offset < size) throw JrnlException(kTooSmall);
   std::memcpy(value, buffer + offset, size);
   offset += size;
}

void BaseJrnlEntry::DeserializeString(const char* buffer, unsigned int length, unsigned int& offset,
                                      std::string& value) {
   uint32_t strLen = ReadInt<uint32_t>(buffer, length, offset);
   if (strLen == 0) throw JrnlException(kUnexpected);
   if (length - offset < strLen) throw JrnlException(kTooSmall);
   const char* text = buffer + offset;
   if (text[strLen - 1] != '\0' || std::memchr(text, '\0', strLen - 1) != nullptr)
      throw JrnlException(kUnexpected);
   value.assign(text, strLen - 1);
   offset += strLen;
}

int BaseJrnlEntry::BaseSerialize(Writer* writer) {
   if (!CheckIntegrity()) throw JrnlException(kInvalidEntry);
   return WriteInt(writer, _op);
}

unsigned int BaseJrnlEntry::BaseDeserialize(const char* buffer, unsigned int length) {
   PELMORA_VERIFY(buffer && length);
   unsigned int offset = 0;
   if (ReadInt<uint32_t>(buffer, length, offset) != _op) throw JrnlException(kUnexpected);
   return offset;
}

void BaseJrnlEntry::CheckConsumed(unsigned int offset, unsigned int length) {
   if (offset != length) throw JrnlException(kUnexpected);
}

int BaseJrnlEntry::Serialize(Writer* writer) { return BaseSerialize(writer); }

void BaseJrnlEntry::Deserialize(char* buffer, unsigned int length) {
   CheckConsumed(BaseDeserialize(buffer, length), length);
}

std::string BaseJrnlEntry::PrintEntry() const { return OpName(_op); }

// End

int JrnlEndEntry::Serialize(Writer* writer) {
   int n = BaseSerialize(writer);
   char flag = _completed ? 1 : 0;
   return n + SerializePrimitive(writer, &flag, 1);
}

void JrnlEndEntry::Deserialize(char* buffer, unsigned int length) {
   unsigned int offset = BaseDeserialize(buffer, length);
   _completed = ReadBool(buffer, length, offset);
   CheckConsumed(offset, length);
}

std::string JrnlEndEntry::PrintEntry() const {
   return std::string("End ") + (_completed ? "completed" : "undone");
}

// UndoFormer

int JrnlUndoFormerEntry::Serialize(Writer* writer) {
   int n = BaseSerialize(writer);
   return n + WriteInt(writer, _beginRecord);
}

void JrnlUndoFormerEntry::Deserialize(char* buffer, unsigned int length) {
   unsigned int offset = BaseDeserialize(buffer, length);
   _beginRecord = ReadInt<int32_t>(buffer, length, offset);
   CheckConsumed(offset, length);
}

std::string JrnlUndoFormerEntry::PrintEntry() const {
   return "UndoFormer record " + std::to_string(_beginRecord);
}

// Dir

int JrnlDirEntry::Serialize(Writer* writer) {
   int n = BaseSerialize(writer);
   char flag = _creation ? 1 : 0;
   n += SerializePrimitive(writer, &flag, 1);
   return n + SerializeString(writer, _path);
}

void JrnlDirEntry::Deserialize(char* buffer, unsigned int length) {
   unsigned int offset = BaseDeserialize(buffer, length);
   _creation = ReadBool(buffer, length, offset);
   DeserializeString(buffer, length, offset, _path);
   CheckConsumed(offset, length);
}

std::string JrnlDirEntry::PrintEntry() const {
   return std::string("Dir ") + (_creation ? "create " : "remove ") + Quote(_path);
}

// File

int JrnlFileEntry::Serialize(Writer* writer) {
   int n = BaseSerialize(writer);
   char flag = _creation ? 1 : 0;
   n += SerializePrimitive(writer, &flag, 1);
   n += WriteInt(writer, _type);
   return n + SerializeString(writer, _path);
}

void JrnlFileEntry::Deserialize(char* buffer, unsigned int length) {
   unsigned int offset = BaseDeserialize(buffer, length);
   _creation = ReadBool(buffer, length, offset);
   _type = ReadInt<uint32_t>(buffer, length, offset);
   DeserializeString(buffer, length, offset, _path);
   CheckConsumed(offset, length);
}

std::string JrnlFileEntry::PrintEntry() const {
   return std::string("File ") + (_creation ? "create " : "remove ") + "type " +
          std::to_string(_type) + " " + Quote(_path);
}

// Fields

int BaseJrnlFieldEntry::SerializeName(Writer* writer) {
   int n = BaseSerialize(writer);
   return n + SerializeString(writer, _name);
}

unsigned int BaseJrnlFieldEntry::DeserializeName(const char* buffer, unsigned int length) {
   unsigned int offset = BaseDeserialize(buffer, length);
   DeserializeString(buffer, length, offset, _name);
   return offset;
}

int JrnlIntFieldEntry::Serialize(Writer* writer) { return SerializeName(writer) + WriteInt(writer, _value); }

void JrnlIntFieldEntry::Deserialize(char* buffer, unsigned int length) {
   unsigned int offset = DeserializeName(buffer, length);
   _value = ReadInt<int32_t>(buffer, length, offset);
   CheckConsumed(offset, length);
}

std::string JrnlIntFieldEntry::PrintEntry() const {
   return "IntField " + Quote(GetName()) + " = " + std::to_string(_value);
}

int JrnlStringFieldEntry::Serialize(Writer* writer) {
   int n = SerializeName(writer);
   return n + SerializeString(writer, _value);
}

void JrnlStringFieldEntry::Deserialize(char* buffer, unsigned int length) {
   unsigned int offset = DeserializeName(buffer, length);
   DeserializeString(buffer, length, offset, _value);
   CheckConsumed(offset, length);
}

std::string JrnlStringFieldEntry::PrintEntry() const {
   return "StringField " + Quote(GetName()) + " = " + Quote(_value);
}

int JrnlLongFieldEntry::Serialize(Writer* writer) { return SerializeName(writer) + WriteInt(writer, _value); }

void JrnlLongFieldEntry::Deserialize(char* buffer, unsigned int length) {
   unsigned int offset = DeserializeName(buffer, length);
   _value = ReadInt<int64_t>(buffer, length, offset);
   CheckConsumed(offset, length);
}

std::string JrnlLongFieldEntry::PrintEntry() const {
   return "LongField " + Quote(GetName()) + " = " + std::to_string(_value);
}

// Creators: each builds its entry from a whole record.

namespace {
template <class Entry>
BaseJrnlEntry* Create(char* buffer, unsigned int length) {
   Ref<Entry> entry = new Entry();
   entry->Deserialize(buffer, length);
   return entry.Release();
}
}  // namespace

BaseJrnlEntry* JrnlBeginEntry::CreateObject(Logger*, char* b, unsigned int n) { return Create<JrnlBeginEntry>(b, n); }
BaseJrnlEntry* JrnlEndEntry::CreateObject(Logger*, char* b, unsigned int n) { return Create<JrnlEndEntry>(b, n); }
BaseJrnlEntry* JrnlUndoFormerEntry::CreateObject(Logger*, char* b, unsigned int n) {
   return Create<JrnlUndoFormerEntry>(b, n);
}
BaseJrnlEntry* JrnlDirEntry::CreateObject(Logger*, char* b, unsigned int n) { return Create<JrnlDirEntry>(b, n); }
BaseJrnlEntry* JrnlFileEntry::CreateObject(Logger*, char* b, unsigned int n) { return Create<JrnlFileEntry>(b, n); }
BaseJrnlEntry* JrnlIntFieldEntry::CreateObject(Logger*, char* b, unsigned int n) {
   return Create<JrnlIntFieldEntry>(b, n);
}
BaseJrnlEntry* JrnlStringFieldEntry::CreateObject(Logger*, char* b, unsigned int n) {
   return Create<JrnlStringFieldEntry>(b, n);
}
BaseJrnlEntry* JrnlLongFieldEntry::CreateObject(Logger*, char* b, unsigned int n) {
   return Create<JrnlLongFieldEntry>(b, n);
}

// Header

int JrnlHeader::Serialize(Writer* writer) {
   PELMORA_VERIFY(writer != NULL);
   if (!CheckIntegrity()) throw JrnlException("Serializing Invalid Header");
   unsigned int strLen = static_cast<unsigned int>(_id.size()) + 1;
   PELMORA_VERIFY(strLen > 0);
   unsigned int neededLen = 21 + static_cast<unsigned int>(_data.size()) + static_cast<unsigned int>(_id.size());
   std::string out(neededLen, '\0');
   PutU32(&out[0], _check1);
   PutU32(&out[4], _check2);
   PutU32(&out[8], _timeStamp);
   PutU32(&out[12], static_cast<uint32_t>(_data.size()));
   std::memcpy(&out[16], _data.data(), _data.size());
   PutU32(&out[16 + _data.size()], strLen);
   std::memcpy(&out[20 + _data.size()], _id.c_str(), strLen);
   unsigned int len = 20 + static_cast<unsigned int>(_data.size()) + strLen;
   PELMORA_VERIFY(len == neededLen);
   writer->Write(out.data(), static_cast<int>(len));
   return static_cast<int>(len);
}

void JrnlHeader::Deserialize(const char* buffer, unsigned int len) {
   PELMORA_VERIFY(buffer && len);
   if (len < 21) throw JrnlException(kTooSmall);
   uint32_t dataLen = ReadU32(buffer + 12);
   if (dataLen > len - 21) throw JrnlException(kTooSmall);
   unsigned int skip = 16 + dataLen;
   uint32_t strLen = ReadU32(buffer + skip);
   skip += 4;
   if (strLen == 0) throw JrnlException(kUnexpected);
   if (strLen > len - skip) throw JrnlException(kTooSmall);
   const char* id = buffer + skip;
   if (id[strLen - 1] != '\0' || std::strlen(id) != strLen - 1) throw JrnlException(kUnexpected);
   skip += strLen;
   // A record longer than its lengths say would hide bytes nobody reads.
   if (skip < len) throw JrnlException(kUnexpected);
   PELMORA_VERIFY(skip == len);
   _check1 = ReadU32(buffer);
   _check2 = ReadU32(buffer + 4);
   _timeStamp = ReadU32(buffer + 8);
   _data.assign(buffer + 16, dataLen);
   _id.assign(id, strLen - 1);
}

std::string JrnlHeader::PrintEntry() const {
   return "Header id " + Quote(_id) + " check " + std::to_string(_check1) + " " + std::to_string(_check2) +
          " time " + std::to_string(_timeStamp) + " data " + std::to_string(_data.size()) + " bytes";
}

}  // namespace Pelmora::Service
