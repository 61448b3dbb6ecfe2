// Configuration files: the backend's rules, gzip (multi-member streams are the core reader's
// to test), size limits, properties files, change detection, and crash safety of writing.

#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <map>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/config.h"
#include "src/config/configBackend.h"
#include "src/config/configBase.h"
#include "tests/support/configViews.h"

using namespace Pelmora;
using namespace Pelmora::Service;
using namespace Pelmora::TestSupport;

namespace {

void WriteFile(const std::string& path, const std::string& text) {
   std::ofstream(path, std::ios::binary) << text;
}
std::string ReadFile(const std::string& path) {
   std::stringstream s;
   s << std::ifstream(path, std::ios::binary).rdbuf();
   return s.str();
}
bool Exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

// The text of the E that `f` raises.
template <class E, class F>
std::string Thrown(F f) {
   try {
      f();
   } catch (const E& e) {
      return e.what();
   }
   return "no exception";
}

// A configuration of about `bytes` bytes whose every value is `mark`.
std::string BigXml(int bytes, const std::string& mark) {
   std::string xml = "<config>\n";
   for (int i = 0; static_cast<int>(xml.size()) < bytes; ++i) {
      xml += "  <item id=\"" + std::to_string(i) + "\">" + mark + "</item>\n";
   }
   return xml + "</config>\n";
}

void WriteThrough(const std::string& path, unsigned flags, const std::string& text) {
   Ref<FileConfigBackend> backend;
   CreateFileConfigBackend(path, -1, flags, backend);
   Ref<Writer> writer;
   backend->Open(writer);
   writer->Write(text.data(), static_cast<int>(text.size()));
   backend->Commit();
   backend->Close();
}

class ConfigFileTest : public testing::Test {
protected:
   void SetUp() override {
      char pattern[] = "/tmp/pelmora-config-XXXXXX";
      ASSERT_NE(mkdtemp(pattern), nullptr);
      _dir = pattern;
   }
   void TearDown() override { std::filesystem::remove_all(_dir); }
   std::string Path(const std::string& name) const { return _dir + "/" + name; }
   std::string _dir;
};

}  // namespace

TEST_F(ConfigFileTest, FilesRoundTripKeepingPermissionsAndLeavingNoTemporaryFile) {
   std::string xml = BigXml(20000, "value"), error;
   Ref<FileConfigBackend> backend;
   error = Thrown<InvalidArgumentException>(
       [&] { CreateFileConfigBackend(Path("x.gz.xml"), -1, kConfigFlagGzip, backend); });
   EXPECT_NE(error.find("fileName (" + Path("x.gz.xml") + ") contains .gz extension"),
             std::string::npos) << error;

   for (unsigned flags : {0u, kConfigFlagGzip}) {
      std::string path = Path(flags ? "gz.xml" : "plain.xml"), file = flags ? path + ".gz" : path;
      WriteThrough(path, flags, xml);
      ASSERT_EQ(chmod(file.c_str(), 0600), 0);
      Ref<Config> config, reread;
      CreateXmlFileConfig(path, -1, flags, config);
      EXPECT_EQ(Text(config.Get(), "item[7]"), "value");
      MainView(config.Get())->Set("item[7]", "  padded ");
      EXPECT_TRUE(config->IsDirty());
      config->Flush();
      EXPECT_FALSE(config->IsDirty());
      EXPECT_FALSE(Exists(file + ".tmp"));
      struct stat st;
      ASSERT_EQ(stat(file.c_str(), &st), 0);
      EXPECT_EQ(st.st_mode & 0777, 0600u);
      CreateXmlFileConfig(path, -1, flags, reread);
      EXPECT_EQ(Text(reread.Get(), "item[7]"), "  padded ");
      EXPECT_EQ(Text(reread.Get(), "item[8]"), "value");
   }
   // The compressed file gained the extension and holds gzip.
   std::string compressed = ReadFile(Path("gz.xml.gz"));
   ASSERT_GE(compressed.size(), 2u);
   EXPECT_EQ(static_cast<unsigned char>(compressed[0]), 0x1f);
   EXPECT_LT(compressed.size(), xml.size() / 4);
   EXPECT_FALSE(Exists(Path("gz.xml")));
}

TEST_F(ConfigFileTest, MissingFileNamesThePath) {
   Ref<Config> config;
   try {
      CreateFlatFileConfig(Path("absent.conf"), config);
      FAIL() << "no exception";
   } catch (const SystemException& e) {
      EXPECT_EQ(e.GetError(), ENOENT);
      EXPECT_EQ(std::string(e.what()), "Failed to open read file " + Path("absent.conf"));
   }
}

TEST_F(ConfigFileTest, DamagedGzipGivesZlibTexts) {
   std::string path = Path("damaged.xml"), gz = path + ".gz";
   WriteThrough(path, kConfigFlagGzip, BigXml(5000, "v"));
   std::string good = ReadFile(gz);
   auto loadError = [&](const std::string& bytes) -> std::string {
      WriteFile(gz, bytes);
      Ref<Config> config;
      try {
         CreateXmlFileConfig(path, -1, kConfigFlagGzip, config);
      } catch (const FileIOException& e) {
         EXPECT_EQ(e.GetPath(), gz);
         return e.what();
      }
      return "no exception";
   };
   std::string flipped = good;
   flipped[good.size() / 2] ^= 0x55;
   flipped[good.size() / 2 + 1] ^= 0x55;
   EXPECT_EQ(loadError(flipped), "Data error : " + gz);
   EXPECT_EQ(loadError(good.substr(0, good.size() / 2)), "Buffer error : " + gz);
   EXPECT_EQ(loadError("not gzip at all"), "Data error : " + gz);
   EXPECT_EQ(loadError(good), "no exception");
}

TEST_F(ConfigFileTest, SizeLimitHoldsForReadingAndWriting) {
   std::string path = Path("limited.conf"), flat;
   for (int i = 0; flat.size() < 40000; ++i) flat += "k" + std::to_string(i) + " = \"v\"\n";
   WriteFile(path, flat);
   Ref<Config> config;
   EXPECT_THROW(CreateFlatFileConfig(path, config), FileIOException);  // the default limit
   std::string error = Thrown<FileIOException>([&] { CreateFlatFileConfig(path, 1000, config); });
   EXPECT_NE(error.find("size limit of 1000 bytes"), std::string::npos) << error;
   CreateFlatFileConfig(path, 100000, config);
   EXPECT_EQ(Text(config.Get(), "k3"), "v");
   // A tree grown past the limit is not written: the old file stays whole.
   WriteFile(path, "a = \"1\"\n");
   CreateFlatFileConfig(path, 200, config);
   for (int i = 0; i < 50; ++i) MainView(config.Get())->Set("key" + std::to_string(i), "value");
   EXPECT_THROW(config->Flush(), FileIOException);
   EXPECT_EQ(ReadFile(path), "a = \"1\"\n");
   EXPECT_FALSE(Exists(path + ".tmp"));
   EXPECT_TRUE(config->IsDirty());
}

TEST_F(ConfigFileTest, SizeLimitIsExact) {
   // The file the writer accepts at exactly the limit must load again; one byte more fails.
   std::string path = Path("exact.conf");
   WriteFile(path, "");
   Ref<Config> config;
   CreateFlatFileConfig(path, config);
   MainView(config.Get())->Set("key", "value");
   config->Flush();
   int size = static_cast<int>(ReadFile(path).size());
   CreateFlatFileConfig(path, size, config);
   EXPECT_EQ(Text(config.Get(), "key"), "value");
   MainView(config.Get())->Set("key", "value1");
   EXPECT_THROW(config->Flush(), FileIOException);
   WriteFile(path, ReadFile(path) + " ");
   EXPECT_THROW(CreateFlatFileConfig(path, size, config), FileIOException);
   CreateFlatFileConfig(path, size + 1, config);
   EXPECT_EQ(Text(config.Get(), "key"), "value");
}

// The steps of a flush as the file system sees them, with one step made to fail.
struct RecordedOps {
   static inline std::vector<std::string> steps;
   static inline std::string failing;  // "fsync", "write" or "rename"
   static std::string Name(int fd) {
      char link[512];
      ssize_t n = readlink(("/proc/self/fd/" + std::to_string(fd)).c_str(), link, sizeof(link));
      std::string name = n > 0 ? std::string(link, n) : "?";
      return name.substr(name.rfind('/') + 1);
   }
   static ssize_t Write(int fd, const void* data, size_t length) {
      steps.push_back("write " + Name(fd));
      if (failing == "write") return errno = ENOSPC, -1;
      return ::write(fd, data, length);
   }
   static int Fsync(int fd) {
      steps.push_back("fsync " + Name(fd));
      if (failing == "fsync") return errno = EIO, -1;
      return ::fsync(fd);
   }
   static int Rename(const char* from, const char* to) {
      steps.push_back("rename");
      if (failing == "rename") return errno = EACCES, -1;
      return ::rename(from, to);
   }
};

TEST_F(ConfigFileTest, FlushSyncsTheNewFileBeforeRenamingAndFailsWhole) {
   const ConfigFileOps ops{RecordedOps::Write, RecordedOps::Fsync, RecordedOps::Rename};
   std::string dir = _dir.substr(_dir.rfind('/') + 1);
   std::string path = Path("durable.conf");
   auto flushed = [&](const std::string& failing) {
      WriteFile(path, "a = \"old\"\n");
      Ref<FileConfigBackend> backend;
      CreateFileConfigBackend(path, -1, 0, ops, backend);
      Ref<ConfigBase> config;
      CreateFlatConfig(backend.Get(), "/", config);
      config->Load();
      MainView(config.Get())->Set("a", "new");
      RecordedOps::steps.clear();
      RecordedOps::failing = failing;
      std::string error = Thrown<SystemException>([&] { config->Flush(); });
      RecordedOps::failing.clear();
      if (!failing.empty()) {
         EXPECT_TRUE(config->IsDirty());
      }
      return error;
   };

   EXPECT_EQ(flushed(""), "no exception");
   EXPECT_EQ(RecordedOps::steps,
             (std::vector<std::string>{"write durable.conf.tmp", "fsync durable.conf.tmp",
                                       "fsync " + dir, "rename", "fsync " + dir}));
   EXPECT_EQ(ReadFile(path), "a = \"new\"\n");

   for (std::string failing : {"write", "fsync", "rename"}) {
      std::string error = flushed(failing);
      EXPECT_NE(error, "no exception") << failing;
      EXPECT_EQ(ReadFile(path), "a = \"old\"\n") << failing;
      EXPECT_FALSE(Exists(path + ".tmp")) << failing;
   }
   EXPECT_EQ(flushed("fsync").rfind("Failed to sync " + path + ".tmp", 0), 0u);
}

TEST_F(ConfigFileTest, BackendAllowsOneReaderOrWriterAtATime) {
   std::string path = Path("one.conf");
   WriteFile(path, "a = \"1\"\n");
   Ref<FileConfigBackend> backend;
   CreateFileConfigBackend(path, -1, 0, backend);
   Ref<Reader> reader;
   Ref<Writer> writer;
   backend->Open(reader);
   EXPECT_THROW(backend->Open(reader), InProgressException);
   EXPECT_THROW(backend->Open(writer), InProgressException);
   backend->Close();
   // A writer closed without Commit leaves the old file and no temporary one.
   backend->Open(writer);
   EXPECT_TRUE(Exists(path + ".tmp"));
   writer->Write("b = \"2\"\n", 8);
   EXPECT_THROW(backend->Open(reader), InProgressException);
   backend->Close();
   EXPECT_EQ(ReadFile(path), "a = \"1\"\n");
   EXPECT_FALSE(Exists(path + ".tmp"));
}

TEST_F(ConfigFileTest, PropertiesFilesRoundTripWithEscapes) {
   std::string path = Path("app.properties");
   WriteFile(path,
             "# comment\n\nlog.level = info  \n  log.name=daemon = main\r\n#not.a = setting\n"
             "path = C:\\data\\xyz\ntabbed = a\\tb\\\\c\nkept = \\ both ends\\ \n"
             "list.item[a.b].x = dotted id\n");
   Ref<Config> config, reread;
   CreatePropertiesFileConfig(path, config);
   const std::pair<const char*, const char*> read[] = {
       {"log/level", "info"},    {"log/name", "daemon = main"}, {"not", "<absent>"},
       {"path", "C:\\data\\xyz"},  // unknown escapes stay
       {"tabbed", "a\tb\\c"},    {"kept", " both ends "},       {"list/item[a.b]/x", "dotted id"}};
   for (auto& [key, value] : read) EXPECT_EQ(Text(config.Get(), key), value) << key;
   const std::string awkward[] = {" lead",       "trail ", "  ",       "tab\tand\nline\rend",
                                  "back\\slash\\", "#hash",  "= equals", "\\ "};
   auto view = MainView(config.Get());
   for (size_t i = 0; i < std::size(awkward); ++i) view->Set("v" + std::to_string(i), awkward[i]);
   config->Flush();
   CreatePropertiesFileConfig(path, reread);
   for (size_t i = 0; i < std::size(awkward); ++i) {
      EXPECT_EQ(Text(reread.Get(), "v" + std::to_string(i)), awkward[i]) << i;
   }
   EXPECT_EQ(Text(reread.Get(), "list/item[a.b]/x"), "dotted id");
   EXPECT_NE(ReadFile(path).find("log.level = info\n"), std::string::npos);

   for (auto [bad, error] : {std::pair{"good = 1\nno equals here\n", "Not a setting at line 2"},
                             std::pair{" = 1\n", "Empty key at line 1"}}) {
      WriteFile(path, bad);
      EXPECT_EQ(Thrown<FileFormatException>([&] { CreatePropertiesFileConfig(path, reread); }),
                std::string("File Format Exception: ") + error);
   }
}

// Reads properties text by the format's own rules, as other readers (Java's among them)
// apply them: "#" and "!" comment lines, lines continued by an odd run of backslashes, the
// key ended by the first unescaped "=", ":" or white space, "\uXXXX" and the other escapes.
// Bytes beyond ASCII pass unchanged: the text is read as UTF-8.
std::map<std::string, std::string> ReadPropertiesByTheFormat(const std::string& text) {
   auto isBlank = [](char c) { return c == ' ' || c == '\t' || c == '\f'; };
   auto unescape = [](const std::string& raw) {
      std::string out;
      for (size_t i = 0; i < raw.size(); ++i) {
         if (raw[i] != '\\' || i + 1 == raw.size()) {
            out += raw[i];
            continue;
         }
         char c = raw[++i];
         if (c == 'u') {
            unsigned code = std::stoul(raw.substr(i + 1, 4), nullptr, 16);
            i += 4;
            if (code < 0x80) {
               out += static_cast<char>(code);
            } else if (code < 0x800) {
               out += static_cast<char>(0xC0 | (code >> 6));
               out += static_cast<char>(0x80 | (code & 0x3F));
            } else {
               out += static_cast<char>(0xE0 | (code >> 12));
               out += static_cast<char>(0x80 | ((code >> 6) & 0x3F));
               out += static_cast<char>(0x80 | (code & 0x3F));
            }
            continue;
         }
         out += c == 't' ? '\t' : c == 'n' ? '\n' : c == 'r' ? '\r' : c == 'f' ? '\f' : c;
      }
      return out;
   };
   std::vector<std::string> natural;
   std::string current;
   for (size_t i = 0; i < text.size(); ++i) {
      if (text[i] == '\n' || text[i] == '\r') {
         natural.push_back(current);
         current.clear();
         if (text[i] == '\r' && i + 1 < text.size() && text[i + 1] == '\n') ++i;
      } else {
         current += text[i];
      }
   }
   if (!current.empty()) natural.push_back(current);
   std::map<std::string, std::string> read;
   for (size_t n = 0; n < natural.size(); ++n) {
      std::string line = natural[n];
      size_t start = 0;
      while (start < line.size() && isBlank(line[start])) ++start;
      if (start == line.size() || line[start] == '#' || line[start] == '!') continue;
      line.erase(0, start);
      for (;;) {  // an odd run of backslashes joins the next line, its blanks dropped
         size_t run = 0;
         while (run < line.size() && line[line.size() - 1 - run] == '\\') ++run;
         if (run % 2 == 0 || n + 1 == natural.size()) break;
         line.pop_back();
         const std::string& next = natural[++n];
         size_t skip = 0;
         while (skip < next.size() && isBlank(next[skip])) ++skip;
         line += next.substr(skip);
      }
      size_t end = 0;
      while (end < line.size()) {
         char c = line[end];
         if (c == '\\') {
            end += 2;
            continue;
         }
         if (c == '=' || c == ':' || isBlank(c)) break;
         ++end;
      }
      end = std::min(end, line.size());
      size_t value = end;
      while (value < line.size() && isBlank(line[value])) ++value;
      if (value < line.size() && (line[value] == '=' || line[value] == ':')) ++value;
      while (value < line.size() && isBlank(line[value])) ++value;
      read[unescape(line.substr(0, end))] = unescape(line.substr(value));
   }
   return read;
}

// Keys holding what other readers take for the end of a key or a comment are escaped, so
// that such readers and this one read the same keys back.
TEST_F(ConfigFileTest, PropertiesKeysReadBackTheSameByTheFormatsRules) {
   std::string path = Path("keys.properties");
   WriteFile(path, "");
   Ref<Config> config, reread;
   CreatePropertiesFileConfig(path, config);
   const std::pair<const char*, const char*> settings[] = {
       {"user[john doe]/role", "yes"},  // read as key "user[john" before
       {"a:b", "colon"},
       {"a=b", "equals"},
       {"tab\there", "tab"},
       {"feed\fhere", "form feed"},
       {"back\\slash[x\\]", "backslash"},
       {"#hash", "hash"},
       {"!bang", "bang"},
       {"in#side!", "not escaped"},
       {" lead", "leading blank"},
       {"caf\xc3\xa9[\xe2\x82\xac]", "\xc3\xa9t\xc3\xa9 = :"},
   };
   auto view = MainView(config.Get());
   for (auto& [key, value] : settings) view->Set(key, value);
   config->Flush();
   std::string text = ReadFile(path);
   EXPECT_NE(text.find("user[john\\ doe].role = yes\n"), std::string::npos) << text;
   EXPECT_NE(text.find("\\#hash = hash\n"), std::string::npos) << text;
   EXPECT_NE(text.find("in#side! = not escaped\n"), std::string::npos) << text;
   EXPECT_NE(text.find("caf\xc3\xa9[\xe2\x82\xac] = "), std::string::npos) << "written as UTF-8";

   std::map<std::string, std::string> expected;
   for (auto& [key, value] : settings) {
      std::string dotted = key;
      std::replace(dotted.begin(), dotted.end(), '/', '.');
      expected[dotted] = value;
   }
   EXPECT_EQ(ReadPropertiesByTheFormat(text), expected);

   CreatePropertiesFileConfig(path, reread);
   for (auto& [key, value] : settings) EXPECT_EQ(Text(reread.Get(), key), value) << key;
   // What the format's own writers produce reads back too, escapes the same.
   WriteFile(path, "a\\:b\\=c\\ d\\\\e\\tf = 1\nplain\\q = 2\n");
   CreatePropertiesFileConfig(path, reread);
   EXPECT_EQ(Text(reread.Get(), "a:b=c d\\e\tf"), "1");
   EXPECT_EQ(Text(reread.Get(), "plain\\q"), "2");  // unknown escapes stay, as in values
}

TEST_F(ConfigFileTest, FlatFileWithAnotherSeparator) {
   std::string path = Path("dots.conf");
   WriteFile(path, "a::b::c = \"1\"\n");
   Ref<Config> config;
   CreateFlatFileConfig(path, std::string("::"), config);
   EXPECT_EQ(Text(config.Get(), "a/b/c"), "1");
   MainView(config.Get())->Set("a/d", "2");
   config->Flush();
   EXPECT_EQ(ReadFile(path), "a::b::c = \"1\"\na::d = \"2\"\n");
}

TEST_F(ConfigFileTest, RefreshReadsAgainOnlyWhenTheFileChanged) {
   std::string path = Path("refresh.conf");
   auto replace = [&](const char* text) {  // a new inode, as editors and Flush do
      WriteFile(path + ".new", text);
      ASSERT_EQ(rename((path + ".new").c_str(), path.c_str()), 0);
   };
   WriteFile(path, "a = \"1\"\n");
   Ref<Config> config;
   CreateFlatFileConfig(path, config);
   EXPECT_FALSE(config->Refresh());
   MainView(config.Get())->Set("a", "2");
   config->Flush();
   EXPECT_FALSE(config->Refresh());  // our own write is not a change
   replace("a = \"3\"\n");
   EXPECT_TRUE(config->Refresh());
   EXPECT_EQ(Text(config.Get(), "a"), "3");
   EXPECT_FALSE(config->Refresh());
   // A malformed new version fails the refresh and keeps the old tree.
   replace("broken\n");
   EXPECT_THROW(config->Refresh(), FileFormatException);
   EXPECT_EQ(Text(config.Get(), "a"), "3");
}

// A child writing two versions in turn is killed at a random moment: the file must then hold
// one version or the other, byte for byte. The child reports on a pipe after each write.
TEST_F(ConfigFileTest, KilledWriterLeavesTheOldOrTheNewFile) {
   std::string path = Path("crash.xml");
   WriteFile(path, "<config/>");
   Ref<Config> config;
   CreateXmlFileConfig(path, 1 << 20, 0, config);
   Ref<Config::View> view = MainView(config.Get());
   auto setAll = [&](const char* mark) {
      for (int i = 0; i < 1500; ++i) view->Set("item[" + std::to_string(i) + "]", mark);
   };
   setAll("second");
   config->Flush();
   const std::string second = ReadFile(path);
   setAll("first");
   config->Flush();
   const std::string first = ReadFile(path);
   ASSERT_GT(first.size(), 40000u);

   std::mt19937 random(12345);
   int completedWrites = 0;
   for (int round = 0; round < 20; ++round) {
      int pipeFds[2];
      ASSERT_EQ(pipe(pipeFds), 0);
      auto forked = std::chrono::steady_clock::now();
      pid_t child = fork();
      ASSERT_GE(child, 0);
      if (child == 0) {  // the configuration came along with the fork: writing starts at once
         close(pipeFds[0]);
         for (int pass = 0;; ++pass) {
            setAll(pass % 2 ? "first" : "second");
            config->Flush();
            if (write(pipeFds[1], "w", 1) != 1) _exit(1);
         }
      }
      close(pipeFds[1]);
      // The first write warms the child up (a forked sanitizer build starts slowly).
      char started = 0;
      ASSERT_EQ(read(pipeFds[0], &started, 1), 1);
      // Kills land anywhere within about three writes at the pace the child writes now,
      // however fast or loaded this machine is.
      long passTime = std::chrono::duration_cast<std::chrono::microseconds>(
                          std::chrono::steady_clock::now() - forked).count();
      long window = std::max<long>(2000, 3 * passTime);
      usleep(static_cast<useconds_t>(random() % window));
      kill(child, SIGKILL);
      int status = 0;
      ASSERT_EQ(waitpid(child, &status, 0), child);
      ASSERT_TRUE(WIFSIGNALED(status));
      char reports[4096];
      for (ssize_t n; (n = read(pipeFds[0], reports, sizeof(reports))) > 0;) {
         completedWrites += static_cast<int>(std::count(reports, reports + n, 'w'));
      }
      close(pipeFds[0]);
      std::string now = ReadFile(path);
      ASSERT_TRUE(now == first || now == second) << "torn file in round " << round;
   }
   // Writes completed between the kills, so kills also met writes of both versions.
   EXPECT_GT(completedWrites, 0);
   Ref<Config> reread;
   CreateXmlFileConfig(path, 1 << 20, 0, reread);
   std::string last = Text(reread.Get(), "item[1499]");
   EXPECT_TRUE(last == "first" || last == "second") << last;
}

TEST(ConfigStringTest, StringRefreshFollowsTheCallersTextAndScratchHasNoSource) {
   std::string text = "a = \"1\"\n";
   Ref<Config> config;
   CreateFlatStringConfig(text, config);
   EXPECT_FALSE(config->Refresh());
   MainView(config.Get())->Set("b", "2");
   text = "a = \"3\"\n";
   EXPECT_TRUE(config->Refresh());
   EXPECT_EQ(Text(config.Get(), "a"), "3");
   EXPECT_EQ(Text(config.Get(), "b"), "<absent>");  // unsaved changes give way
   EXPECT_FALSE(config->IsDirty());
   EXPECT_FALSE(config->Refresh());

   CreateScratchConfig(config);
   EXPECT_THROW(config->Load(), NotSupportedException);
   EXPECT_THROW(config->Flush(), NotSupportedException);
   EXPECT_FALSE(config->Refresh());
}