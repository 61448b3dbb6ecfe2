// The line syntaxes on FlatConfigBase: flat files (key = "value") and properties files
// (key = value, "#" comments). A key is the path of a node with its segments joined by the
// configuration's separator; separators inside "[...]" belong to the id.

#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/messageFormatter.h"
#include "src/config/configBase.h"

namespace Pelmora::Service {

using Node = ConfigBase::Node;

namespace {

constexpr size_t kWriteChunk = 65536;

[[noreturn]] void ThrowLine(const char* what, int line) {
   throw FileFormatException(MessageFormatter::ASPrint("%1 at line %2", what, line));
}

class FlatConfigBase : public ConfigBase {
public:
   FlatConfigBase(ConfigBackend* backend, const std::string& separator)
       : ConfigBase(backend), _separator(separator) {
      if (_separator.empty()) throw InvalidArgumentException("empty key separator");
   }

   void Parse(const std::string& text, Ref<Node>& root) override {
      Ref<Node> tree = new Node(kRootTag, nullptr);
      std::string_view rest = text;
      int lineNumber = 0;
      std::string key;
      std::string value;
      while (!rest.empty()) {
         size_t end = rest.find('\n');
         std::string_view line = rest.substr(0, end);
         rest = end == std::string_view::npos ? std::string_view() : rest.substr(end + 1);
         ++lineNumber;
         if (!ParseLine(line, lineNumber, key, value)) continue;
         Insert(tree.Get(), key, std::move(value), lineNumber);
      }
      root = tree;
   }

   void Write(const Node* root, Writer* writer) override {
      if (root->HasValue()) throw InvalidArgumentException("the root value has no key in this syntax");
      std::string out;
      std::string key;
      for (const Ref<Node>& child : root->GetChildren()) WriteNode(child.Get(), key, out, writer);
      writer->Write(out.data(), static_cast<int>(out.size()));
   }

protected:
   // Splits a line into key and value; false for a comment.
   virtual bool ParseLine(std::string_view line, int lineNumber, std::string& key,
                          std::string& value) = 0;
   virtual void AppendLine(std::string& out, const std::string& key, const std::string& value) = 0;
   // Whether a key may start with `c` in this syntax.
   virtual bool KeyMayStartWith(char c) const { return !IsTrimmed(c); }
   // The characters no part of a key may hold in this syntax.
   virtual const char* RefusedInKeys() const { return "=\n\r"; }

private:
   void Insert(Node* root, std::string_view key, std::string value, int lineNumber) {
      Node* node = root;
      int depth = 0;
      size_t start = 0;
      bool inId = false;
      for (size_t i = 0; i <= key.size(); ++i) {
         bool atEnd = i == key.size();
         if (!atEnd) {
            char c = key[i];
            if (c == '[') inId = true;
            else if (c == ']') inId = false;
            if (inId || key.compare(i, _separator.size(), _separator) != 0) continue;
         }
         if (i > start) {
            PathSegment segment;
            if (!ParseSegment(key.substr(start, i - start), segment)) ThrowLine("Malformed key", lineNumber);
            if (++depth > kConfigMaxDepth) ThrowLine("Key nested too deep", lineNumber);
            try {
               node = MakeChild(node, segment);
            } catch (const InvalidArgumentException&) {
               ThrowLine("Node has both value and children", lineNumber);
            }
         }
         if (!atEnd) i += _separator.size() - 1;
         start = i + 1;
      }
      if (node == root) ThrowLine("Empty key", lineNumber);
      if (!node->GetChildren().empty()) ThrowLine("Node has both value and children", lineNumber);
      node->SetValue(std::move(value));
   }

   void WriteNode(const Node* node, std::string& key, std::string& out, Writer* writer) {
      size_t keyLength = key.size();
      if (!key.empty()) key += _separator;
      CheckKeyPart(node->GetTag(), false, key.empty());
      key += node->GetTag();
      if (node->HasId()) {
         CheckKeyPart(node->GetId(), true, false);
         key += '[';
         key += node->GetId();
         key += ']';
      }
      if (node->HasValue()) {
         if (IsTrimmed(key.back())) throw InvalidArgumentException("key ends in white space: " + key);
         AppendLine(out, key, node->GetValue());
      }
      for (const Ref<Node>& child : node->GetChildren()) WriteNode(child.Get(), key, out, writer);
      key.resize(keyLength);
      if (out.size() >= kWriteChunk) {
         writer->Write(out.data(), static_cast<int>(out.size()));
         out.clear();
      }
   }

   // What would not read back as the same key.
   void CheckKeyPart(const std::string& part, bool id, bool first) {
      bool bad = part.find_first_of(RefusedInKeys()) != std::string::npos;
      if (id) {
         bad = bad || part.find(']') != std::string::npos;
      } else {
         bad = bad || part.find(_separator) != std::string::npos ||
               part.find('[') != std::string::npos || part.empty();
         if (first && !part.empty()) bad = bad || !KeyMayStartWith(part[0]);
      }
      if (bad) throw InvalidArgumentException("cannot be written as part of a key: " + part);
   }

   std::string _separator;
};

class FlatConfigImpl : public FlatConfigBase {
public:
   using FlatConfigBase::FlatConfigBase;

protected:
   bool ParseLine(std::string_view line, int lineNumber, std::string& key,
                  std::string& value) override {
      if (Trim(line).empty()) return false;
      size_t equals = line.find('=');
      if (equals == std::string_view::npos || equals == 0) ThrowLine("Not a setting", lineNumber);
      size_t open = line.find('"', equals + 1);
      size_t close = line.rfind('"');
      if (open == std::string_view::npos || close <= open) ThrowLine("Not a setting", lineNumber);
      key.assign(Trim(line.substr(0, equals)));
      value.assign(line.substr(open + 1, close - open - 1));
      return true;
   }

   void AppendLine(std::string& out, const std::string& key, const std::string& value) override {
      if (value.find('\n') != std::string::npos) {
         throw InvalidArgumentException("a flat value cannot hold a line feed: " + key);
      }
      out += key;
      out += " = \"";
      out += value;
      out += "\"\n";
   }
};

class PropertiesConfigImpl : public FlatConfigBase {
public:
   using FlatConfigBase::FlatConfigBase;

protected:
   bool ParseLine(std::string_view line, int lineNumber, std::string& key,
                  std::string& value) override {
      std::string_view trimmed = Trim(line);
      if (trimmed.empty() || trimmed[0] == '#') return false;
      size_t equals = FindKeyEnd(line);
      if (equals == std::string_view::npos) ThrowLine("Not a setting", lineNumber);
      Unescape(TrimValue(line.substr(0, equals)), key, true);
      if (key.empty()) ThrowLine("Empty key", lineNumber);
      Unescape(TrimValue(line.substr(equals + 1)), value, false);
      return true;
   }

   void AppendLine(std::string& out, const std::string& key, const std::string& value) override {
      AppendKey(out, key);
      out += " = ";
      for (size_t i = 0; i < value.size(); ++i) {
         char c = value[i];
         switch (c) {
            case '\\': out += "\\\\"; break;
            case '\n': out += "\\n"; break;
            case '\r': out += "\\r"; break;
            case '\t': out += "\\t"; break;
            case ' ':
               // Blanks at either end would be trimmed away.
               if (i == 0 || i + 1 == value.size()) out += '\\';
               out += c;
               break;
            default: out += c;
         }
      }
      out += '\n';
   }

   // Every character a key may open with is escaped where another reader would misread it.
   bool KeyMayStartWith(char) const override { return true; }
   const char* RefusedInKeys() const override { return "\n\r"; }

private:
   // Where other readers would end the key or take the line for a comment.
   static void AppendKey(std::string& out, const std::string& key) {
      for (size_t i = 0; i < key.size(); ++i) {
         char c = key[i];
         switch (c) {
            case '\t': out += "\\t"; break;
            case '\f': out += "\\f"; break;
            case '\\':
            case ' ':
            case ':':
            case '=':
               out += '\\';
               out += c;
               break;
            case '#':
            case '!':
               if (i == 0) out += '\\';
               out += c;
               break;
            default: out += c;
         }
      }
   }

   // The first "=" that no backslash escapes.
   static size_t FindKeyEnd(std::string_view line) {
      for (size_t i = 0; i < line.size(); ++i) {
         if (line[i] == '\\') {
            ++i;
         } else if (line[i] == '=') {
            return i;
         }
      }
      return std::string_view::npos;
   }

   // Trims like Trim, but keeps a white-space character that a backslash escapes.
   static std::string_view TrimValue(std::string_view text) {
      size_t begin = 0;
      size_t end = text.size();
      while (begin < end && IsTrimmed(text[begin])) ++begin;
      size_t full = end;
      while (end > begin && IsTrimmed(text[end - 1])) --end;
      if (end < full) {
         size_t backslashes = 0;
         while (end - backslashes > begin && text[end - backslashes - 1] == '\\') ++backslashes;
         if (backslashes % 2 == 1) ++end;
      }
      return text.substr(begin, end - begin);
   }

   // Undoes the escapes of a key (`key`) or a value. Both read "\\", "\t" and "\ "; keys
   // also "\f", ":", "=", "#" and "!", values "\n" and "\r". Unknown escapes stay as
   // written, so files written before keys were escaped read as they did.
   static void Unescape(std::string_view text, std::string& out, bool key) {
      out.clear();
      for (size_t i = 0; i < text.size(); ++i) {
         char c = text[i];
         if (c != '\\' || i + 1 == text.size()) {
            out += c;
            continue;
         }
         char next = text[++i];
         char plain = 0;
         switch (next) {
            case '\\': case ' ': plain = next; break;
            case 't': plain = '\t'; break;
            case 'f': plain = key ? '\f' : 0; break;
            case ':': case '=': case '#': case '!': plain = key ? next : 0; break;
            case 'n': plain = key ? 0 : '\n'; break;
            case 'r': plain = key ? 0 : '\r'; break;
         }
         if (plain) {
            out += plain;
         } else {
            out += '\\';
            out += next;
         }
      }
   }
};

const char kFlatSeparator[] = "/";
const char kPropertiesSeparator[] = ".";

Ref<Config> LoadNew(ConfigBase* config) {
   Ref<ConfigBase> held = config;
   held->Load();
   return held;
}

Ref<FileConfigBackend> FileBackend(const std::string& path, int sizeLimit) {
   Ref<FileConfigBackend> backend;
   CreateFileConfigBackend(path, sizeLimit, 0, backend);
   return backend;
}

}  // namespace

void CreateFlatConfig(ConfigBackend* backend, const std::string& separator, Ref<ConfigBase>& out) {
   out = new FlatConfigImpl(backend, separator);
}

void CreatePropertiesConfig(ConfigBackend* backend, Ref<ConfigBase>& out) {
   out = new PropertiesConfigImpl(backend, kPropertiesSeparator);
}

void CreateFlatFileConfig(const std::string& path, Ref<Config>& out) {
   out = LoadNew(new FlatConfigImpl(FileBackend(path, kConfigDefaultSizeLimit).Get(), kFlatSeparator));
}

void CreateFlatFileConfig(const std::string& path, int sizeLimit, Ref<Config>& out) {
   out = LoadNew(new FlatConfigImpl(FileBackend(path, sizeLimit).Get(), kFlatSeparator));
}

void CreateFlatFileConfig(const std::string& path, const std::string& separator, Ref<Config>& out) {
   out = LoadNew(new FlatConfigImpl(FileBackend(path, kConfigDefaultSizeLimit).Get(), separator));
}

void CreateFlatStringConfig(std::string& text, Ref<Config>& out) {
   Ref<ConfigBackend> backend;
   CreateStringConfigBackend(text, backend);
   out = LoadNew(new FlatConfigImpl(backend.Get(), kFlatSeparator));
}

void CreatePropertiesFileConfig(const std::string& path, Ref<Config>& out) {
   out = LoadNew(new PropertiesConfigImpl(FileBackend(path, kConfigDefaultSizeLimit).Get(),
                                          kPropertiesSeparator));
}

void CreatePropertiesFileConfig(const std::string& path, int sizeLimit, Ref<Config>& out) {
   out = LoadNew(new PropertiesConfigImpl(FileBackend(path, sizeLimit).Get(), kPropertiesSeparator));
}

}  // namespace Pelmora::Service
