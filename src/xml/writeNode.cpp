// Serialisation: text escaping, the compact and pretty forms of each node kind, and the
// formatter that lets a node stand as a message argument. Everything goes straight to the
// writer in small pieces; no string of the whole document is built.

#include <array>
#include <climits>
#include <cstddef>

#include "pelmora/exception/exceptions.h"
#include "pelmora/formatter/printFormatter.h"
#include "src/xml/nodeImpl.h"

namespace Pelmora::Xml {
namespace {

// Writer::Write takes an int length; longer pieces go in several writes.
void WriteBytes(Writer* writer, const char* data, size_t length) {
   while (length > static_cast<size_t>(INT_MAX)) {
      writer->Write(data, INT_MAX);
      data += INT_MAX;
      length -= INT_MAX;
   }
   if (length > 0) writer->Write(data, static_cast<int>(length));
}

void WriteString(Writer* writer, const std::string& text) {
   WriteBytes(writer, text.data(), text.size());
}

// Two spaces per level.
void WriteIndent(Writer* writer, int indent) {
   static const char kSpaces[] = "                                                                ";
   constexpr int kLevelsPerWrite = (sizeof(kSpaces) - 1) / 2;
   while (indent > 0) {
      int levels = indent < kLevelsPerWrite ? indent : kLevelsPerWrite;
      writer->Write(kSpaces, levels * 2);
      indent -= levels;
   }
}

constexpr std::array<bool, 256> kEscaped = [] {
   std::array<bool, 256> escaped{};
   for (int c = 0; c < 32; ++c) escaped[c] = c != '\t' && c != '\n' && c != '\r';
   for (unsigned char c : {'<', '>', '&', '\'', '"'}) escaped[c] = true;
   return escaped;
}();

const ElementNodeImpl* AsElement(const NodeImpl* node) {
   return node->GetNodeType() == kElementNode ? static_cast<const ElementNodeImpl*>(node) : nullptr;
}

}  // namespace

void WriteText(Writer* writer, const std::string& text) {
   static const char kHex[] = "0123456789abcdef";
   const char* data = text.data();
   size_t start = 0;
   for (size_t i = 0; i < text.size(); ++i) {
      unsigned char c = static_cast<unsigned char>(data[i]);
      if (!kEscaped[c]) continue;
      WriteBytes(writer, data + start, i - start);
      start = i + 1;
      switch (c) {
         case '<':
            writer->Write("&lt;", 4);
            break;
         case '>':
            writer->Write("&gt;", 4);
            break;
         case '&':
            writer->Write("&amp;", 5);
            break;
         case '\'':
            writer->Write("&apos;", 6);
            break;
         case '"':
            writer->Write("&quot;", 6);
            break;
         default: {
            // Deliberately not a character reference: control bytes are not XML characters.
            const char percent[3] = {'%', kHex[c >> 4], kHex[c & 0x0f]};
            writer->Write(percent, 3);
         }
      }
   }
   WriteBytes(writer, data + start, text.size() - start);
}

bool ElementNodeImpl::IsBlockLayout(int indent) const {
   const NodeImpl* first = FirstChildImpl();
   if (indent < 0 || !first) return false;
   int type = first->GetNodeType();
   return type == kElementNode || type == kCommentNode;
}

bool ElementNodeImpl::WriteStartTag(Writer* writer, int indent) const {
   WriteIndent(writer, indent);
   writer->Write("<", 1);
   if (!_name->prefix.empty()) {
      WriteString(writer, _name->prefix);
      writer->Write(":", 1);
   }
   WriteString(writer, _name->tag);
   for (const auto& [name, value] : _attributes) {
      writer->Write(" ", 1);
      WriteString(writer, name);
      writer->Write("=\"", 2);
      WriteText(writer, value);
      writer->Write("\"", 1);
   }
   if (!FirstChildImpl()) {
      writer->Write("/>", 2);
      return false;
   }
   writer->Write(">", 1);
   return true;
}

void ElementNodeImpl::WriteEndTag(Writer* writer, int indent) const {
   if (IsBlockLayout(indent)) {
      writer->Write("\n", 1);
      WriteIndent(writer, indent);
   }
   writer->Write("</", 2);
   if (!_name->prefix.empty()) {
      WriteString(writer, _name->prefix);
      writer->Write(":", 1);
   }
   WriteString(writer, _name->tag);
   writer->Write(">", 1);
}

void ElementNodeImpl::WriteNode(Writer* writer, int indent) const {
   // A walk along the tree links instead of recursion: a parsed document may nest deeper
   // than the stack allows.
   const NodeImpl* node = this;
   int level = indent;
   for (;;) {
      const ElementNodeImpl* element = AsElement(node);
      if (!element) {
         node->WriteNode(writer, level);
      } else if (element->WriteStartTag(writer, level)) {
         if (element->IsBlockLayout(level)) writer->Write("\n", 1);
         node = element->FirstChildImpl();
         if (level >= 0) ++level;
         continue;
      }
      // `node` is written: go on to its next sibling, closing each parent that is done.
      for (;;) {
         if (node == this) return;
         const auto* parent = static_cast<const ElementNodeImpl*>(node->ParentImpl());
         int parentLevel = level < 0 ? -1 : level - 1;
         if (const NodeImpl* next = node->NextSiblingImpl()) {
            if (parent->IsBlockLayout(parentLevel)) writer->Write("\n", 1);
            node = next;
            break;
         }
         node = parent;
         level = parentLevel;
         parent->WriteEndTag(writer, level);
      }
   }
}

void TextNodeImpl::WriteNode(Writer* writer, int) const {
   WriteText(writer, _text);
}

// Content that would end the construct early is refused before anything of the node is
// written; checking here costs nothing for the elements and text that make up most trees.

void CDataNodeImpl::WriteNode(Writer* writer, int) const {
   // The end marker may also be split across text children.
   int brackets = 0;
   for (const NodeImpl* child = FirstChildImpl(); child; child = child->NextSiblingImpl()) {
      for (char c : static_cast<const TextNodeImpl*>(child)->GetText()) {
         if (c == '>' && brackets >= 2)
            throw InvalidArgumentException("CDATA section holds \"]]>\"");
         brackets = c == ']' ? brackets + 1 : 0;
      }
   }
   writer->Write("<![CDATA[", 9);
   for (const NodeImpl* child = FirstChildImpl(); child; child = child->NextSiblingImpl())
      WriteString(writer, static_cast<const TextNodeImpl*>(child)->GetText());
   writer->Write("]]>", 3);
}

void CommentNodeImpl::WriteNode(Writer* writer, int indent) const {
   if (_comment.find("--") != std::string::npos)
      throw InvalidArgumentException("comment holds \"--\"");
   if (!_comment.empty() && _comment.back() == '-')
      throw InvalidArgumentException("comment ends in \"-\"");
   WriteIndent(writer, indent);
   writer->Write("<!--", 4);
   WriteString(writer, _comment);
   writer->Write("-->\n", 4);
}

void ProcessingInstructionNodeImpl::WriteNode(Writer* writer, int) const {
   VerifyName("processing-instruction target", _target);
   if (_target.size() == 3 && (_target[0] | 0x20) == 'x' && (_target[1] | 0x20) == 'm' &&
       (_target[2] | 0x20) == 'l') {
      throw InvalidArgumentException("processing-instruction target \"" + _target +
                                     "\" is reserved");
   }
   if (_data.find("?>") != std::string::npos)
      throw InvalidArgumentException("processing-instruction data holds \"?>\"");
   writer->Write("<?", 2);
   WriteString(writer, _target);
   writer->Write(" ", 1);
   WriteString(writer, _data);
   writer->Write("?>", 2);
}

void DocumentImpl::WriteNode(Writer* writer, int indent) const {
   if (!_root) throw InvalidStateException("No root - no doc.");
   if (!_version.empty()) {
      writer->Write("<?xml version=\"", 15);
      WriteString(writer, _version);
      writer->Write("\"", 1);
      if (!_encoding.empty()) {
         writer->Write(" encoding=\"", 11);
         WriteString(writer, _encoding);
         writer->Write("\"", 1);
      }
      writer->Write("?>\n", 3);
   }
   for (const NodeImpl* child = FirstChildImpl(); child; child = child->NextSiblingImpl())
      child->WriteNode(writer, indent);
}

}  // namespace Pelmora::Xml
