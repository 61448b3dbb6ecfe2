#pragma once
// A Config is a tree of tagged string values read from and written to a file or a string
// in one of three syntaxes (XML, flat "key = "value"" lines, properties), or kept in memory
// only. Callers read and write typed values through Views addressed by slash-separated
// paths; each view also sees a second tree of defaults that answers when the main tree has
// no value. A Config and its views are thread-safe; a view keeps its Config alive.
//
// Paths: segments are separated by "/", empty segments are skipped ("a//b/" is "a/b"), and
// a segment may carry an id in square brackets ("level[0003]"). A segment holding "[" that
// does not end in "]" raises InvalidArgumentException.

#include <string>
#include <vector>

#include "pelmora/object/export.h"
#include "pelmora/object/ref.h"

namespace Pelmora::Service {

class PELMORA_EXPORT Config : public virtual Object {
public:
   class View : public virtual Object {
   public:
      // Each Get answers from the main tree, else from the defaults tree, and returns
      // whether either held a value. Unparsable text raises NumberFormatException.
      virtual bool Get(const std::string& path, std::string* value) = 0;
      virtual bool Get(const std::string& path, int* value) = 0;
      virtual bool Get(const std::string& path, unsigned int* value) = 0;
      virtual bool Get(const std::string& path, long long* value) = 0;
      virtual bool Get(const std::string& path, double* value) = 0;
      // "true" or "false" in any case.
      virtual bool Get(const std::string& path, bool* value) = 0;

      // Each Set writes the main tree, creating the nodes along the path. A node holds a
      // value or children, never both: setting a value on a node with children, or below a
      // node with a non-empty value, raises InvalidArgumentException.
      virtual void Set(const std::string& path, const char* value) = 0;
      virtual void Set(const std::string& path, int value) = 0;
      virtual void Set(const std::string& path, unsigned int value) = 0;
      virtual void Set(const std::string& path, long long value) = 0;
      // Shortest text that reads back as the same double.
      virtual void Set(const std::string& path, double value) = 0;
      // "true" or "false".
      virtual void Set(const std::string& path, bool value) = 0;
      void Set(const std::string& path, const std::string& value) { Set(path, value.c_str()); }

      // Removes the node at `path` with its subtree from the main tree, and the ancestors
      // this leaves empty. Nothing happens when there is no such node.
      virtual void Unset(const std::string& path) = 0;
      // Whether the main tree holds a node at `path` (defaults do not count).
      virtual bool IsSet(const std::string& path) = 0;
      // A view whose prefix is this view's prefix followed by `path`; the nodes need not exist.
      virtual void GetView(const std::string& path, Ref<View>& out) = 0;
      // The names ("tag" or "tag[id]") of the children of the node at `path`: the main
      // tree's in order, then those only the defaults tree has. Each name is a path segment.
      virtual void GetChildNames(const std::string& path, std::vector<std::string>& names) = 0;
      // The next id for a new child tagged like the last segment of `path`, under the
      // parent that the rest of `path` names: "0000" for the first; after "0041", "0042";
      // after an id not ending in four digits, or ending in "9999", that id + "0000".
      // InvalidArgumentException when the last such child has no id.
      virtual void GenerateId(const std::string& path, std::string* id) = 0;
   };

   // A view of the whole main tree (with the defaults behind it).
   virtual void GetMainView(Ref<View>& out) = 0;
   // A view whose main tree is the defaults tree, to fill or read the defaults directly.
   virtual void GetDefaultsMainView(Ref<View>& out) = 0;
   virtual void GetView(const std::string& path, Ref<View>& out) = 0;
   virtual void GetDefaultsView(const std::string& path, Ref<View>& out) = 0;

   // Reads the source again, replacing the main tree; on failure the tree is unchanged.
   // FileFormatException for malformed text; SystemException or FileIOException for I/O.
   virtual void Load() = 0;
   // Writes the main tree to the source. A file is replaced whole: a crash or power loss
   // leaves the old file or the new one. InvalidArgumentException for a tree the syntax
   // cannot hold (a line break in a flat value, a tag that is not an XML name ...).
   virtual void Flush() = 0;
   // Loads again when the source changed since the last Load or Flush (a file: its
   // identity, size or times; a string: its text), discarding unsaved changes; returns
   // whether it did. A version that fails to load is not tried again until it changes.
   // Memory-only configurations never change.
   virtual bool Refresh() = 0;
   // Whether the main tree changed since the last Load or Flush (defaults do not count).
   virtual bool IsDirty() = 0;
};

// FileConfigBackend flag: the file is gzip-compressed and its name gains ".gz".
constexpr unsigned kConfigFlagGzip = 2;
// The size limit, in bytes, of file factories without one and of negative limits. The
// limit applies to the uncompressed text, read or written.
constexpr int kConfigDefaultSizeLimit = 32768;
// Files nesting nodes deeper than this raise FileFormatException: settings are shallow,
// and the bound keeps recursive walks of a hostile file within the stack.
constexpr int kConfigMaxDepth = 256;

// The file factories read the file at once: a file that cannot be opened raises
// SystemException ("Failed to open read file " + path), malformed text FileFormatException.
PELMORA_EXPORT void CreateXmlFileConfig(const std::string& path, int sizeLimit, unsigned flags, Ref<Config>& out);
// `text` is read now and written by Flush; it must outlive the configuration. Empty (or
// blank) text is an empty configuration.
PELMORA_EXPORT void CreateXmlStringConfig(std::string& text, Ref<Config>& out);
// Flat files: one `key = "value"` line per value, keys joined with "/" unless `separator`
// says otherwise; empty lines are skipped, any other line that is not a setting raises
// FileFormatException.
PELMORA_EXPORT void CreateFlatFileConfig(const std::string& path, Ref<Config>& out);
PELMORA_EXPORT void CreateFlatFileConfig(const std::string& path, int sizeLimit, Ref<Config>& out);
PELMORA_EXPORT void CreateFlatFileConfig(const std::string& path, const std::string& separator, Ref<Config>& out);
PELMORA_EXPORT void CreateFlatStringConfig(std::string& text, Ref<Config>& out);
// Properties files: `key = value` lines, keys joined with "."; "#" lines are comments.
// In values a backslash escapes: "\\" a backslash, "\n" a line feed, "\r" a carriage
// return, "\t" a tab, "\ " a blank kept at either end; other backslashes stay as written.
// Keys are written so that other properties readers split them where this one does: a
// backslash goes before every blank, ":", "=" and backslash, and before "#" or "!" opening
// the key; tab and form feed are written "\t" and "\f". Reading undoes these escapes and
// takes the key up to the first "=" no backslash escapes. Files are UTF-8, characters
// beyond ASCII written as they are (not as \uXXXX): Java's Properties must load them
// through a UTF-8 Reader, not an InputStream.
PELMORA_EXPORT void CreatePropertiesFileConfig(const std::string& path, Ref<Config>& out);
PELMORA_EXPORT void CreatePropertiesFileConfig(const std::string& path, int sizeLimit, Ref<Config>& out);
// Memory only: Load and Flush raise NotSupportedException.
PELMORA_EXPORT void CreateScratchConfig(Ref<Config>& out);

// Copies the main subtree that `defaults` sees into the defaults tree of `config`, over
// what is there (values of `defaults` win). `config` must come from the factories above.
PELMORA_EXPORT void SetConfigDefaults(Config* config, Config::View* defaults);

// Sets the XML parser's default document limits (Xml::SetDefaultDocLimits) from the keys
// "pelmora/xml/doc/maxChars", "pelmora/xml/doc/maxNodes" and "pelmora/xml/doc/maxDepth"
// under `view`; a missing key keeps its default. A negative value is a panic.
PELMORA_EXPORT void LoadXmlDocLimits(Config::View* view);

}  // namespace Pelmora::Service
