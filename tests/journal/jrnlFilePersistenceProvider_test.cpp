// The journal file: its header, records appended whole, and a torn last record.

#include <gtest/gtest.h>

#include <fstream>
#include <sstream>
#include <unistd.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/service/journal.h"
#include "tests/support/journalBytes.h"

namespace Pelmora::Service {
namespace {

using namespace Pelmora::TestSupport;

class JrnlFileProviderTest : public testing::Test {
protected:
   void SetUp() override {
      char name[] = "/tmp/jrnlprovXXXXXX";
      _dir = ::mkdtemp(name);
      _path = _dir + "/j";
   }
   void TearDown() override {
      ::unlink(_path.c_str());
      ::rmdir(_dir.c_str());
   }

   std::vector<std::string> ReadRecords(JrnlPersistenceProvider* provider) {
      std::vector<std::string> out;
      char* buffer = nullptr;
      unsigned int length = 0;
      provider->RewindToStart();
      while (provider->ReadRecord(buffer, length)) {
         EXPECT_EQ(buffer[length], '\0');
         out.emplace_back(buffer, length);
         delete[] buffer;
      }
      return out;
   }

   std::string _dir;
   std::string _path;
};

TEST_F(JrnlFileProviderTest, RecordsFollowTheFileHeader) {
   Ref<JrnlPersistenceProvider> provider;
   CreateJrnlFilePersistenceProvider(_path, true, provider);
   provider->WriteRecord("abc", 3);
   // An empty record could not be told from a torn one.
   EXPECT_THROW(provider->WriteRecord("", 0), InvalidArgumentException);
   provider->WriteRecord("xy", 2);
   EXPECT_EQ(ReadAll(_path), std::string("NORVEX.JOURNAL.VER.1.0.") + U32(3) + "abc" + U32(2) + "xy");
   EXPECT_TRUE(provider->IsValidFileHeader());
   EXPECT_EQ(ReadRecords(provider.Get()), (std::vector<std::string>{"abc", "xy"}));
   EXPECT_EQ(GetJrnlFileHeader(_path), "NORVEX.JOURNAL.VER.1.0.");
}

TEST_F(JrnlFileProviderTest, CreationFailures) {
   Ref<JrnlPersistenceProvider> provider;
   CreateJrnlFilePersistenceProvider(_path, true, provider);
   try {
      CreateJrnlFilePersistenceProvider(_path, true, provider);
      FAIL();
   } catch (const JrnlException& e) {
      EXPECT_STREQ(e.what(), "The journal already exists");
   }
   try {
      CreateJrnlFilePersistenceProvider(_dir + "/no/such", true, provider);
      FAIL();
   } catch (const JrnlException& e) {
      EXPECT_EQ(e.GetMessage(), "Failed to create journal file: " + _dir + "/no/such.");
   }
}

TEST_F(JrnlFileProviderTest, ADifferentFileHeaderIsNotAJournal) {
   WriteAll(_path, "NORVEX.JOURNAL.VER.1.1." + U32(1) + "a");
   Ref<JrnlPersistenceProvider> provider;
   CreateJrnlFilePersistenceProvider(_path, false, provider);
   EXPECT_FALSE(provider->IsValidFileHeader());
   WriteAll(_path, "NORVEX.JOURNAL");
   CreateJrnlFilePersistenceProvider(_path, false, provider);
   EXPECT_FALSE(provider->IsValidFileHeader());
}

TEST_F(JrnlFileProviderTest, TornLastRecordIsIgnoredAndCutOffBeforeTheNextWrite) {
   const std::string good = std::string("NORVEX.JOURNAL.VER.1.0.") + U32(2) + "ok";
   for (const std::string& tail : {U32(9) + "abc", std::string("\x05\x00", 2), std::string(12, '\0')}) {
      WriteAll(_path, good + tail);
      Ref<JrnlPersistenceProvider> provider;
      CreateJrnlFilePersistenceProvider(_path, false, provider);
      EXPECT_EQ(ReadRecords(provider.Get()), std::vector<std::string>{"ok"});
      provider->WriteRecord("next", 4);
      EXPECT_EQ(ReadAll(_path), good + U32(4) + "next");
      EXPECT_EQ(ReadRecords(provider.Get()), (std::vector<std::string>{"ok", "next"}));
   }
}

}  // namespace
}  // namespace Pelmora::Service
