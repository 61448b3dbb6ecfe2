// Configuration files: the backend's rules, gzip, size limits, properties files, change
// detection, and crash safety of writing.

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <fstream>
#include <random>
#include <sstream>
#include <string>

#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io.h"
#include "pelmora/service/config.h"
#include "src/service/configBackend.h"

using namespace Pelmora;
using namespace Pelmora::Service;

namespace {

class ConfigFileTest : public testing::Test {
protected:
   void SetUp() override {
      char pattern[] = "/tmp/pelmora-config-XXXXXX";
      ASSERT_NE(mkdtemp(pattern), nullptr);
      _dir = pattern;
   }
   void TearDown() override {
      if (DIR* dir = opendir(_dir.c_str())) {
         while (dirent* entry = readdir(dir)) {
            std::string name = entry->d_name;
            if (name != "." && name != "..") unlink((_dir + "/" + name).c_str());
         }
         closedir(dir);
      }
      rmdir(_dir.c_str());
   }

   std::string Path(const std::string& name) const { return _dir + "/" + name; }

   static void WriteFile(const std::string& path, const std::string& text) {
      std::ofstream(path, std::ios::binary) << text;
   }
   static std::string ReadFile(const std::string& path) {
      std::ifstream in(path, std::ios::binary);
      std::stringstream s;
      s << in.rdbuf();
      return s.str();
   }
   static bool Exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

   static Ref<Config::View> MainView(Config* config) {
      Ref<Config::View> view;
      config->GetMainView(view);
      return view;
   }
   static std::string GetText(Config* config, const std::string& path) {
      std::string value;
      if (!MainView(config)->Get(path, &value)) return "<absent>";
      return value;
   }

   std::string _dir;
};

// A configuration of about `bytes` bytes whose every value is `mark`.
std::string BigXml(int bytes, const std::string& mark) {
   std::string xml = "<config>\n";
   for (int i = 0; static_cast<int>(xml.size()) < bytes; ++i) {
      xml += "  <item id=\"" + std::to_string(i) + "\">" + mark + "</item>\n";
   }
   return xml + "</config>\n";
}

}  // namespace

TEST_F(ConfigFileTest, XmlFileRoundTripsAndLeavesNoTemporaryFile) {
   std::string path = Path("app.xml");
   WriteFile(path, "<config><log><level>info</level></log></config>");
   Ref<Config> config;
   CreateXmlFileConfig(path, -1, 0, config);
   EXPECT_EQ(GetText(config.Get(), "log/level"), "info");
   MainView(config.Get())->Set("log/name", "  padded ");
   EXPECT_TRUE(config->IsDirty());
   config->Flush();
   EXPECT_FALSE(config->IsDirty());
   EXPECT_FALSE(Exists(path + ".tmp"));

   Ref<Config> reread;
   CreateXmlFileConfig(path, -1, 0, reread);
   EXPECT_EQ(GetText(reread.Get(), "log/name"), "  padded ");
   EXPECT_EQ(GetText(reread.Get(), "log/level"), "info");
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

TEST_F(ConfigFileTest, GzipFilesGainTheExtensionAndRoundTrip) {
   std::string path = Path("app.xml");
   Ref<FileConfigBackend> backend;
   EXPECT_THROW(CreateFileConfigBackend(Path("app.xml.gz"), -1, kConfigFlagGzip, backend),
                InvalidArgumentException);
   try {
      CreateFileConfigBackend(Path("x.gz.xml"), -1, kConfigFlagGzip, backend);
   } catch (const InvalidArgumentException& e) {
      EXPECT_NE(std::string(e.what()).find("fileName (" + Path("x.gz.xml") + ") contains .gz extension"),
                std::string::npos);
   }

   // Write a compressed file through the backend, then read it as a configuration.
   CreateFileConfigBackend(path, -1, kConfigFlagGzip, backend);
   Ref<Writer> writer;
   backend->Open(writer);
   std::string xml = BigXml(20000, "value");
   writer->Write(xml.data(), static_cast<int>(xml.size()));
   backend->Commit();
   backend->Close();
   ASSERT_TRUE(Exists(path + ".gz"));
   EXPECT_FALSE(Exists(path));
   std::string compressed = ReadFile(path + ".gz");
   ASSERT_GE(compressed.size(), 2u);
   EXPECT_EQ(static_cast<unsigned char>(compressed[0]), 0x1f);  // gzip magic
   EXPECT_LT(compressed.size(), xml.size() / 4);

   Ref<Config> config;
   CreateXmlFileConfig(path, -1, kConfigFlagGzip, config);
   EXPECT_EQ(GetText(config.Get(), "item[7]"), "value");
   MainView(config.Get())->Set("item[7]", "changed");
   config->Flush();
   Ref<Config> reread;
   CreateXmlFileConfig(path, -1, kConfigFlagGzip, reread);
   EXPECT_EQ(GetText(reread.Get(), "item[7]"), "changed");
   EXPECT_EQ(GetText(reread.Get(), "item[8]"), "value");
}

TEST_F(ConfigFileTest, DamagedGzipGivesZlibTexts) {
   std::string path = Path("damaged.xml");
   Ref<FileConfigBackend> backend;
   CreateFileConfigBackend(path, -1, kConfigFlagGzip, backend);
   Ref<Writer> writer;
   backend->Open(writer);
   std::string xml = BigXml(5000, "v");
   writer->Write(xml.data(), static_cast<int>(xml.size()));
   backend->Commit();
   backend->Close();
   std::string good = ReadFile(path + ".gz");

   auto loadError = [&](const std::string& bytes) -> std::string {
      WriteFile(path + ".gz", bytes);
      Ref<Config> config;
      try {
         CreateXmlFileConfig(path, -1, kConfigFlagGzip, config);
      } catch (const FileIOException& e) {
         EXPECT_EQ(e.GetPath(), path + ".gz");
         return e.what();
      }
      return "no exception";
   };
   std::string flipped = good;
   flipped[good.size() / 2] ^= 0x55;
   flipped[good.size() / 2 + 1] ^= 0x55;
   EXPECT_EQ(loadError(flipped), "Data error : " + path + ".gz");
   EXPECT_EQ(loadError(good.substr(0, good.size() / 2)), "Buffer error : " + path + ".gz");
   EXPECT_EQ(loadError("not gzip at all"), "Data error : " + path + ".gz");
   EXPECT_EQ(loadError(good), "no exception");
}

TEST_F(ConfigFileTest, SizeLimitHoldsForReadingAndWriting) {
   std::string path = Path("limited.conf");
   std::string flat;
   for (int i = 0; flat.size() < 40000; ++i) flat += "k" + std::to_string(i) + " = \"v\"\n";
   WriteFile(path, flat);
   Ref<Config> config;
   // The default limit is 32768 bytes.
   EXPECT_THROW(CreateFlatFileConfig(path, config), FileIOException);
   try {
      CreateFlatFileConfig(path, 1000, config);
      FAIL() << "no exception";
   } catch (const FileIOException& e) {
      EXPECT_NE(std::string(e.what()).find("size limit of 1000 bytes"), std::string::npos) << e.what();
   }
   CreateFlatFileConfig(path, 100000, config);
   EXPECT_EQ(GetText(config.Get(), "k3"), "v");

   // A tree grown past the limit is not written: the old file stays whole.
   WriteFile(path, "a = \"1\"\n");
   CreateFlatFileConfig(path, 200, config);
   for (int i = 0; i < 50; ++i) MainView(config.Get())->Set("key" + std::to_string(i), "value");
   EXPECT_THROW(config->Flush(), FileIOException);
   EXPECT_EQ(ReadFile(path), "a = \"1\"\n");
   EXPECT_FALSE(Exists(path + ".tmp"));
   EXPECT_TRUE(config->IsDirty());
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

TEST_F(ConfigFileTest, ReplacingKeepsTheFilesPermissions) {
   std::string path = Path("secret.conf");
   WriteFile(path, "a = \"1\"\n");
   ASSERT_EQ(chmod(path.c_str(), 0600), 0);
   Ref<Config> config;
   CreateFlatFileConfig(path, config);
   MainView(config.Get())->Set("a", "2");
   config->Flush();
   struct stat st;
   ASSERT_EQ(stat(path.c_str(), &st), 0);
   EXPECT_EQ(st.st_mode & 0777, 0600u);
}

TEST_F(ConfigFileTest, PropertiesFilesRoundTripWithEscapes) {
   std::string path = Path("app.properties");
   WriteFile(path,
             "# comment\n"
             "\n"
             "log.level = info  \n"
             "  log.name=daemon = main\r\n"
             "#not.a = setting\n"
             "path = C:\\data\\xyz\n"
             "tabbed = a\\tb\\\\c\n"
             "kept = \\ both ends\\ \n"
             "list.item[a.b].x = dotted id\n");
   Ref<Config> config;
   CreatePropertiesFileConfig(path, config);
   EXPECT_EQ(GetText(config.Get(), "log/level"), "info");
   EXPECT_EQ(GetText(config.Get(), "log/name"), "daemon = main");
   EXPECT_EQ(GetText(config.Get(), "not"), "<absent>");
   EXPECT_EQ(GetText(config.Get(), "path"), "C:\\data\\xyz");  // unknown escapes stay
   EXPECT_EQ(GetText(config.Get(), "tabbed"), "a\tb\\c");
   EXPECT_EQ(GetText(config.Get(), "kept"), " both ends ");
   EXPECT_EQ(GetText(config.Get(), "list/item[a.b]/x"), "dotted id");

   const std::string awkward[] = {" lead", "trail ", "  ", "tab\tand\nline\rend", "back\\slash\\",
                                  "#hash", "= equals", "\\ "};
   auto view = MainView(config.Get());
   for (size_t i = 0; i < std::size(awkward); ++i) view->Set("odd/v" + std::to_string(i), awkward[i]);
   config->Flush();
   Ref<Config> reread;
   CreatePropertiesFileConfig(path, reread);
   for (size_t i = 0; i < std::size(awkward); ++i) {
      EXPECT_EQ(GetText(reread.Get(), "odd/v" + std::to_string(i)), awkward[i]) << i;
   }
   EXPECT_EQ(GetText(reread.Get(), "list/item[a.b]/x"), "dotted id");
   EXPECT_NE(ReadFile(path).find("log.level = info\n"), std::string::npos);

   WriteFile(path, "good = 1\nno equals here\n");
   try {
      CreatePropertiesFileConfig(path, reread);
      FAIL() << "no exception";
   } catch (const FileFormatException& e) {
      EXPECT_STREQ(e.what(), "File Format Exception: Not a setting at line 2");
   }
   WriteFile(path, " = 1\n");
   EXPECT_THROW(CreatePropertiesFileConfig(path, reread), FileFormatException);
}

TEST_F(ConfigFileTest, FlatFileWithAnotherSeparator) {
   std::string path = Path("dots.conf");
   WriteFile(path, "a::b::c = \"1\"\n");
   Ref<Config> config;
   CreateFlatFileConfig(path, std::string("::"), config);
   EXPECT_EQ(GetText(config.Get(), "a/b/c"), "1");
   MainView(config.Get())->Set("a/d", "2");
   config->Flush();
   EXPECT_EQ(ReadFile(path), "a::b::c = \"1\"\na::d = \"2\"\n");
}

TEST_F(ConfigFileTest, RefreshReadsAgainOnlyWhenTheFileChanged) {
   std::string path = Path("refresh.conf");
   WriteFile(path, "a = \"1\"\n");
   Ref<Config> config;
   CreateFlatFileConfig(path, config);
   EXPECT_FALSE(config->Refresh());
   MainView(config.Get())->Set("a", "2");
   config->Flush();
   EXPECT_FALSE(config->Refresh());  // our own write is not a change

   // Another writer replaces the file (a new inode, as editors and Flush do).
   WriteFile(path + ".new", "a = \"3\"\n");
   ASSERT_EQ(rename((path + ".new").c_str(), path.c_str()), 0);
   EXPECT_TRUE(config->Refresh());
   EXPECT_EQ(GetText(config.Get(), "a"), "3");
   EXPECT_FALSE(config->Refresh());

   // A malformed new version fails the refresh and keeps the old tree.
   WriteFile(path + ".new", "broken\n");
   ASSERT_EQ(rename((path + ".new").c_str(), path.c_str()), 0);
   EXPECT_THROW(config->Refresh(), FileFormatException);
   EXPECT_EQ(GetText(config.Get(), "a"), "3");
}

// A child writes a large configuration over and over, alternating two versions, and is
// killed at a random moment; the file must then hold one version or the other, byte for
// byte. The child reports on a pipe after each complete write.
TEST_F(ConfigFileTest, KilledWriterLeavesTheOldOrTheNewFile) {
   std::string path = Path("crash.xml");
   WriteFile(path, "<config/>");
   Ref<Config> config;
   CreateXmlFileConfig(path, 1 << 20, 0, config);
   Ref<Config::View> view;
   config->GetMainView(view);
   auto setAll = [&](const char* mark) {
      for (int i = 0; i < 1500; ++i) view->Set("item[" + std::to_string(i) + "]", mark);
   };
   setAll("second");
   config->Flush();
   const std::string second = ReadFile(path);
   auto start = std::chrono::steady_clock::now();
   setAll("first");
   config->Flush();
   auto passTime = std::chrono::duration_cast<std::chrono::microseconds>(
       std::chrono::steady_clock::now() - start);
   const std::string first = ReadFile(path);
   ASSERT_GT(first.size(), 40000u);
   // Kills land anywhere within about three writes, however fast this machine writes.
   const long window = std::max<long>(2000, 3 * passTime.count());

   std::mt19937 random(12345);
   int completedWrites = 0;
   const int rounds = 20;
   for (int round = 0; round < rounds; ++round) {
      int pipeFds[2];
      ASSERT_EQ(pipe(pipeFds), 0);
      pid_t child = fork();
      ASSERT_GE(child, 0);
      if (child == 0) {
         // The configuration came along with the fork: no load, the writing starts at once.
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
      usleep(static_cast<useconds_t>(random() % window));
      kill(child, SIGKILL);
      int status = 0;
      ASSERT_EQ(waitpid(child, &status, 0), child);
      ASSERT_TRUE(WIFSIGNALED(status));
      char reports[4096];
      ssize_t n;
      while ((n = read(pipeFds[0], reports, sizeof(reports))) > 0) {
         completedWrites += static_cast<int>(std::count(reports, reports + n, 'w'));
      }
      close(pipeFds[0]);
      std::string now = ReadFile(path);
      ASSERT_TRUE(now == first || now == second) << "a torn file in round " << round << ", "
                                                  << now.size() << " bytes";
   }
   // Writes completed between the kills, so kills also met writes of both versions.
   EXPECT_GT(completedWrites, 0);
   Ref<Config> reread;
   CreateXmlFileConfig(path, 1 << 20, 0, reread);
   EXPECT_TRUE(GetText(reread.Get(), "item[1499]") == "first" ||
               GetText(reread.Get(), "item[1499]") == "second");
}

TEST(GzipStreamTest, ManyMembersReadAsOneStream) {
   Ref<StringWriter> target;
   CreateStringWriter(target);
   for (int member = 0; member < 3; ++member) {
      Ref<StringWriter> part;
      CreateStringWriter(part);
      Ref<Writer> gzip;
      CreateGzippedFileWriter(part.Get(), "part", gzip);
      std::string text = "member " + std::to_string(member) + ";";
      gzip->Write(text.data(), static_cast<int>(text.size()));
      gzip->Close();
      target->Write(part->GetString().data(), part->GetLength());
   }
   std::string bytes = target->GetString();
   Ref<StringReader> source;
   CreateStringReader(bytes.data(), static_cast<int>(bytes.size()), source);
   Ref<Reader> gunzip;
   CreateGzippedFileReader(source.Get(), "joined", gunzip);
   std::string out;
   char buffer[5];
   int n;
   while ((n = gunzip->Read(buffer, sizeof(buffer))) >= 0) out.append(buffer, n);
   EXPECT_EQ(out, "member 0;member 1;member 2;");
}
