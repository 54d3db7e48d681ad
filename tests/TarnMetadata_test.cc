#include "Daemon/TarnMetadata.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnPropertyListFile.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

class TarnMetadataTest : public test::ScratchRootTest {
protected:
    void SetUp() override { TarnUserIdentityCache::TEST_setPersonasAreSupported(false); }
    void TearDown() override { TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt); }

    TarnUserIdentityRef mobile() { return TarnUserIdentityCache::defaultUserIdentity(); }

    // A container directory of `containerClass` in its proper place.
    FileURL containerDir(TarnContainerClass containerClass, const Uuid& uuid) {
        auto base = TarnGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
            mobile(), containerClass, false);
        FileURL dir = PathJoin(*base, uuid.string());
        std::filesystem::create_directories(dir);
        return dir;
    }

    TarnMutableMetadataRef make(TarnContainerClass containerClass,
                                std::optional<PlistValue> info = std::nullopt) {
        Uuid uuid = Uuid::generate();
        auto identity = TarnConcreteContainerIdentity::containerIdentityWithUUID(
                            uuid, mobile(), "com.ostrea.app", containerClass)
                            .value();
        return TarnMetadata::initWithContainerIdentity(identity, std::move(info),
                                                       containerDir(containerClass, uuid), "Assets");
    }

    static void writeDict(const FileURL& dir, const PlistValue& dict) {
        auto bytes = dict.toBinary();
        std::ofstream(PathJoin(dir, kTarnMetadataFileName), std::ios::binary | std::ios::trunc)
            .write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
    }

    // Reads `dir`, expecting failure with `code`; returns the message.
    std::string expectRejected(const FileURL& dir, uint64_t code,
                               TarnUserIdentityRef expected = nullptr, bool checkClassPath = false) {
        auto m = TarnMetadata::readAndValidateMetadataAtUrl(dir, expected ? expected : mobile(),
                                                            checkClassPath);
        EXPECT_FALSE(m.ok());
        const TarnErrorRef error = m.error();
        if (!error) {
            ADD_FAILURE() << "no error";
            return "";
        }
        EXPECT_EQ(error->code(), code);
        EXPECT_TRUE(error->isTarn());
        // The error and its line name the step that refused the file, as they
        // always have: log readers search for these names.
        EXPECT_EQ(error->functionName(),
                  code == TarnErrorReadFailed ? "validate" : "validateFields");
        return error->localizedDescription().value_or("");
    }
};

TEST_F(TarnMetadataTest, WriteThenReadKeepsEveryField) {
    PlistValue info(PlistDict{{kTarnInfoContentProtectionClassKey, PlistValue(uint64_t{3})}});
    auto m = make(2, info);
    TarnStatus written = m->writeMetadataToDiskWithError();
    ASSERT_TRUE(written.ok()) << (written.error() ? written.error()->description() : "");

    auto readBack = TarnMetadata::readAndValidateMetadataAtUrl(m->url(), mobile(), true);
    ASSERT_TRUE(readBack.ok()) << (readBack.error() ? readBack.error()->description() : "");
    const TarnMetadataRef read = *readBack;
    EXPECT_EQ(read->uuid(), m->uuid());
    EXPECT_EQ(read->identifier(), "com.ostrea.app");
    EXPECT_EQ(read->containerClass(), 2u);
    EXPECT_EQ(read->url(), m->url());
    EXPECT_EQ(read->userManagedAssetsDirName(), "Assets");
    ASSERT_TRUE(read->info());
    EXPECT_EQ(*read->info(), info);
    EXPECT_TRUE(read->userIdentity()->isEqual(*mobile()));
    EXPECT_TRUE(read->containerIdentity()->isEqual(*m->containerIdentity()));

    // Nothing is left behind in the staging directory.
    auto staging = TarnGlobalConfiguration::sharedInstance().stagingDirectoryURLForUserIdentity(mobile(), 2);
    EXPECT_TRUE(std::filesystem::is_empty(staging));
}

TEST_F(TarnMetadataTest, StoredFormAndGlobalClassesWithoutUserIdentity) {
    auto m = make(12);
    ASSERT_TRUE(m->writeMetadataToDiskWithError().ok());
    auto stored = Tarn_dictionaryWithContentsOfURL(PathJoin(m->url(), kTarnMetadataFileName), 0);
    ASSERT_TRUE(stored.ok());
    EXPECT_EQ(stored->find(kTarnMetadataUserIdentityKey), nullptr);
    EXPECT_EQ(stored->find(kTarnMetadataInfoKey), nullptr);
    EXPECT_EQ(*stored->find(kTarnMetadataVersionKey)->asString(), "2");
    EXPECT_EQ(*stored->find(kTarnMetadataUUIDKey)->asString(), m->uuid().string());

    auto data = make(2);
    auto dict = data->dictionaryRepresentation();
    ASSERT_TRUE(dict.find(kTarnMetadataUserIdentityKey));
    EXPECT_EQ(*dict.find(kTarnMetadataUserIdentityKey), mobile()->plist());
}

TEST_F(TarnMetadataTest, IndependentReaderSeesABinaryPlist) {
    if (std::system("python3 -c 'import plistlib' >/dev/null 2>&1") != 0) {
        GTEST_SKIP() << "python3 with plistlib not available";
    }
    auto m = make(2, PlistValue(PlistDict{{"k", PlistValue("v")}}));
    ASSERT_TRUE(m->writeMetadataToDiskWithError().ok());
    const FileURL file = PathJoin(m->url(), kTarnMetadataFileName);
    const std::string out = root_.at("/python.txt");
    const std::string cmd =
        "python3 -c 'import plistlib,sys; f=open(sys.argv[1],\"rb\"); b=f.read(); "
        "assert b.startswith(b\"bplist00\"); d=plistlib.loads(b); "
        "print(d[\"TarnMetadataIdentifier\"], d[\"TarnMetadataContentClass\"], "
        "d[\"TarnMetadataUUID\"], d[\"TarnMetadataVersion\"], "
        "d[\"TarnMetadataUserIdentity\"][\"posixUID\"], d[\"TarnMetadataUserIdentity\"][\"version\"], "
        "d[\"TarnMetadataInfo\"][\"k\"])' '" +
        file + "' > '" + out + "'";
    ASSERT_EQ(std::system(cmd.c_str()), 0);
    std::ifstream in(out);
    std::string line;
    std::getline(in, line);
    EXPECT_EQ(line, "com.ostrea.app 2 " + m->uuid().string() + " 2 501 2 v");
}

TEST_F(TarnMetadataTest, EveryMalformedFieldRejectsTheContainer) {
    auto m = make(2);
    const PlistValue good = m->dictionaryRepresentation();
    const FileURL dir = m->url();

    EXPECT_NE(expectRejected(dir, TarnErrorReadFailed).find("Failed to read metadata at URL"),
              std::string::npos)
        << "no file";
    std::ofstream(PathJoin(dir, kTarnMetadataFileName)) << "garbage";
    expectRejected(dir, TarnErrorReadFailed);
    writeDict(dir, PlistValue(PlistArray{PlistValue("x")}));
    expectRejected(dir, TarnErrorReadFailed);

    struct Case {
        const char* key;
        std::optional<PlistValue> value;  // nullopt: remove the key
        const char* message;
    };
    const Case cases[] = {
        {kTarnMetadataIdentifierKey, std::nullopt, "Invalid metadata Identifier"},
        {kTarnMetadataIdentifierKey, PlistValue(uint64_t{1}), "Invalid metadata Identifier"},
        {kTarnMetadataUUIDKey, PlistValue(uint64_t{1}), "Invalid metadata UUID String"},
        {kTarnMetadataUUIDKey, PlistValue("not-a-uuid"), "Invalid metadata UUID: not-a-uuid"},
        {kTarnMetadataContentClassKey, PlistValue("2"), "Invalid metadata Class"},
        {kTarnMetadataContentClassKey, PlistValue(uint64_t{14}), "Invalid metadata Content Class: 14"},
        {kTarnMetadataContentClassKey, PlistValue(uint64_t{0}), "Invalid metadata Content Class: 0"},
        {kTarnMetadataContentClassKey, PlistValue(2.5), "Invalid metadata Content Class"},
        {kTarnMetadataPersonaKey, PlistValue(uint64_t{502}), "Incorrect UserId"},
        {kTarnMetadataUserIdentityKey, PlistValue(PlistDict{{"version", PlistValue("3")}}),
         "Invalid metadata User Identity"},
        // The line shows the stored dictionary, however the file was decoded.
        {kTarnMetadataUserIdentityKey,
         PlistValue(PlistDict{{"posixGID", PlistValue(uint64_t{501})},
                              {"posixUID", PlistValue("501")},
                              {"type", PlistValue(uint64_t{0})},
                              {"version", PlistValue("2")}}),
         "posixGID"},
        {kTarnMetadataInfoKey, PlistValue(PlistArray{}), "Invalid metadata Info"},
        {kTarnMetadataUserManagedAssetsDirNameKey, PlistValue(uint64_t{5}),
         "Invalid metadata User Managed Dir Name String"},
    };
    for (const auto& c : cases) {
        PlistValue dict = good;
        if (c.value) dict.set(c.key, *c.value);
        else dict.erase(c.key);
        writeDict(dir, dict);
        std::string message = expectRejected(dir, TarnErrorInvalidMetadata);
        EXPECT_NE(message.find(c.message), std::string::npos) << c.key << ": " << message;
    }

    // The version key plays no part.
    for (std::optional<PlistValue> version : {std::optional<PlistValue>(), std::optional(PlistValue("1"))}) {
        PlistValue dict = good;
        if (version) dict.set(kTarnMetadataVersionKey, *version);
        else dict.erase(kTarnMetadataVersionKey);
        writeDict(dir, dict);
        EXPECT_TRUE(TarnMetadata::readAndValidateMetadataAtUrl(dir, mobile(), true).ok());
    }
}

// Most files are decoded entry by entry; what that reader declines (here a
// key that is not one-byte text) goes through the whole-tree reader and must
// read the same.
TEST_F(TarnMetadataTest, AFileTheEntriesReaderDeclinesReadsTheSame) {
    PlistValue info(PlistDict{{kTarnInfoContentProtectionClassKey, PlistValue(uint64_t{3})}});
    auto m = make(2, info);
    PlistValue dict = m->dictionaryRepresentation();
    for (bool declined : {false, true}) {
        if (declined) dict.set("\xC3\x9Cnknown", PlistValue("x"));
        writeDict(m->url(), dict);
        std::vector<uint8_t> bytes = dict.toBinary();
        PlistEntries entries;
        ASSERT_EQ(PlistBinaryRootEntries(bytes.data(), bytes.size(), &entries), !declined);
        auto readBack = TarnMetadata::readAndValidateMetadataAtUrl(m->url(), mobile(), true);
        ASSERT_TRUE(readBack.ok()) << (readBack.error() ? readBack.error()->description() : "");
        const TarnMetadataRef read = *readBack;
        EXPECT_EQ(read->identifier(), m->identifier());
        EXPECT_EQ(read->uuid(), m->uuid());
        EXPECT_EQ(read->info(), info);
        EXPECT_EQ(read->userManagedAssetsDirName(), "Assets");
        EXPECT_TRUE(read->userIdentity()->isEqual(*mobile()));
    }
}

TEST_F(TarnMetadataTest, OldFormatWithoutUserIdentity) {
    auto m = make(2);
    PlistValue dict = m->dictionaryRepresentation();
    dict.erase(kTarnMetadataUserIdentityKey);
    dict.set(kTarnMetadataPersonaKey, PlistValue(uint64_t{501}));
    writeDict(m->url(), dict);
    auto read = TarnMetadata::readAndValidateMetadataAtUrl(m->url(), mobile(), true);
    ASSERT_TRUE(read.ok());
    EXPECT_EQ((*read)->userIdentity()->posixUID(), 501u);
    EXPECT_EQ((*read)->userIdentity()->personaType(), TarnPersonaTypePersonal);

    auto other = TarnUserIdentity::initWithUID(502, 502, root_.at("/private/var/u502"), std::nullopt,
                                               0, 502);
    std::string message = expectRejected(m->url(), TarnErrorInvalidMetadata, other);
    EXPECT_NE(message.find("Incorrect UserId: 501, expecting: 502"), std::string::npos) << message;

    // Whole numbers written as reals (by another tool) read as the numbers.
    dict.set(kTarnMetadataPersonaKey, PlistValue(501.0));
    dict.set(kTarnMetadataContentClassKey, PlistValue(2.0));
    writeDict(m->url(), dict);
    EXPECT_TRUE(TarnMetadata::readAndValidateMetadataAtUrl(m->url(), mobile(), true).ok());
    dict.set(kTarnMetadataContentClassKey, PlistValue(uint64_t{2}));

    // Without either key the expected user is assumed.
    dict.erase(kTarnMetadataPersonaKey);
    writeDict(m->url(), dict);
    EXPECT_TRUE(TarnMetadata::readAndValidateMetadataAtUrl(m->url(), mobile(), true).ok());
}

TEST_F(TarnMetadataTest, StoredIdentityMustMatchTheExpectedOne) {
    auto m = make(2);
    ASSERT_TRUE(m->writeMetadataToDiskWithError().ok());
    // Same uid, different identity: an enterprise persona of the same user.
    auto enterprise = TarnUserIdentity::initWithUID(501, 501, root_.at("/private/var/ent"), "E-1",
                                                    TarnPersonaTypeEnterprise, 77);
    std::string message = expectRejected(m->url(), TarnErrorInvalidMetadata, enterprise);
    EXPECT_NE(message.find("Incorrect User Identity"), std::string::npos) << message;
}

TEST_F(TarnMetadataTest, ClassPathMustMatchTheClassDirectory) {
    Uuid uuid = Uuid::generate();
    auto identity =
        TarnConcreteContainerIdentity::containerIdentityWithUUID(uuid, mobile(), "com.b", 1)
            .value();
    // A bundle container found below the user's Data/Application.
    FileURL misplaced = containerDir(2, uuid);
    auto m = TarnMetadata::initWithContainerIdentity(identity, std::nullopt, misplaced, std::nullopt);
    ASSERT_TRUE(m->writeMetadataToDiskWithError().ok());
    std::string message = expectRejected(misplaced, TarnErrorInvalidMetadata, nullptr, true);
    EXPECT_NE(message.find("Invalid metadata-URLs should match"), std::string::npos) << message;
    EXPECT_TRUE(TarnMetadata::readAndValidateMetadataAtUrl(misplaced, mobile(), false).ok());

    FileURL proper = containerDir(1, uuid);
    auto placed = TarnMetadata::initWithContainerIdentity(identity, std::nullopt, proper, std::nullopt);
    ASSERT_TRUE(placed->writeMetadataToDiskWithError().ok());
    EXPECT_TRUE(TarnMetadata::readAndValidateMetadataAtUrl(proper, mobile(), true).ok());
}

TEST_F(TarnMetadataTest, TheClassDirectoryReaderAnswersAsThePathReader) {
    auto m = make(2, PlistValue(PlistDict{{kTarnInfoContentProtectionClassKey, PlistValue(3)}}));
    ASSERT_TRUE(m->writeMetadataToDiskWithError().ok());
    const FileURL classDirectory = PathParent(m->url());
    FsFd directory;
    ASSERT_EQ(TarnFileManager::defaultManager().openDirectoryAtURL(classDirectory, &directory), 0);

    auto pathRead = TarnMetadata::readAndValidateMetadataAtUrl(m->url(), mobile(), true);
    auto directoryRead =
        TarnMetadata::readAndValidateMetadataInClassDirectory(directory, m->url(), mobile(), true);
    ASSERT_TRUE(pathRead.ok());
    ASSERT_TRUE(directoryRead.ok());
    const TarnMetadataRef byPath = *pathRead;
    const TarnMetadataRef byDirectory = *directoryRead;
    EXPECT_EQ(byDirectory->url(), byPath->url());
    EXPECT_EQ(byDirectory->uuid(), byPath->uuid());
    EXPECT_EQ(byDirectory->identifier(), byPath->identifier());
    EXPECT_EQ(byDirectory->containerClass(), byPath->containerClass());
    EXPECT_EQ(byDirectory->info(), byPath->info());
    EXPECT_EQ(byDirectory->userManagedAssetsDirName(), byPath->userManagedAssetsDirName());
    EXPECT_TRUE(byDirectory->userIdentity()->isEqualToUserIdentity(*byPath->userIdentity()));

    // What stands in place of the file is refused, never waited on.
    const FileURL file = PathJoin(m->url(), kTarnMetadataFileName);
    auto expectUnreadable = [&](const char* what) {
        auto read = TarnMetadata::readAndValidateMetadataInClassDirectory(directory, m->url(),
                                                                          mobile(), true);
        EXPECT_FALSE(read.ok()) << what;
        ASSERT_TRUE(read.error()) << what;
        EXPECT_EQ(read.error()->code(), TarnErrorReadFailed) << what;
        EXPECT_FALSE(TarnMetadata::readAndValidateMetadataAtUrl(m->url(), mobile(), true).ok())
            << what << ": the path reader agrees";
        // Asked to stay quiet (as a rebuild does), both fail without an error value.
        for (auto quiet : {TarnMetadata::readAndValidateMetadataInClassDirectory(
                               directory, m->url(), mobile(), true, TarnMetadataUnreadable::kQuiet),
                           TarnMetadata::readAndValidateMetadataAtUrl(
                               m->url(), mobile(), true, TarnMetadataUnreadable::kQuiet)}) {
            EXPECT_FALSE(quiet.ok()) << what;
            EXPECT_FALSE(quiet.error()) << what;
        }
    };
    const FileURL kept = PathJoin(classDirectory, "kept.plist");
    std::filesystem::rename(file, kept);
    std::filesystem::create_symlink(kept, file);
    expectUnreadable("a link");
    std::filesystem::remove(file);
    ASSERT_EQ(::mkfifo(file.c_str(), 0600), 0);
    expectUnreadable("a FIFO without a writer");
    std::filesystem::remove(file);
    std::filesystem::create_directory(file);
    expectUnreadable("a directory");
    std::filesystem::remove(file);
    std::ofstream(file).put('\0');
    expectUnreadable("a file that is no property list");
    std::filesystem::remove(file);
    expectUnreadable("no file");

    // A file longer than one read comes back whole.
    std::filesystem::rename(kept, file);
    auto big = m->copy();
    big->setInfo(PlistValue(PlistDict{{"Padding", PlistValue(std::string(100000, 'p'))}}));
    ASSERT_TRUE(big->writeMetadataToDiskWithError().ok());
    auto read =
        TarnMetadata::readAndValidateMetadataInClassDirectory(directory, m->url(), mobile(), true);
    ASSERT_TRUE(read.ok());
    EXPECT_EQ((*read)->info(), big->info());
}

TEST_F(TarnMetadataTest, FailedWriteKeepsTheOldFile) {
    auto m = make(2);
    ASSERT_TRUE(m->writeMetadataToDiskWithError().ok());
    auto before = Tarn_dictionaryWithContentsOfURL(PathJoin(m->url(), kTarnMetadataFileName), 0);
    ASSERT_TRUE(before.ok());
    // The container directory vanished: the move fails, nothing partial appears.
    auto gone = m->copy();
    gone->setUrl(PathJoin(m->url(), "missing/dir"));
    gone->setUserManagedAssetsDirName("Other");
    EXPECT_EQ(gone->writeMetadataToDiskWithError().code(TarnSuccess),
              uint64_t{TarnErrorWriteFailed});
    auto after = Tarn_dictionaryWithContentsOfURL(PathJoin(m->url(), kTarnMetadataFileName), 0);
    ASSERT_TRUE(after.ok());
    EXPECT_EQ(*before, *after);
    auto staging = TarnGlobalConfiguration::sharedInstance().stagingDirectoryURLForUserIdentity(mobile(), 2);
    EXPECT_TRUE(std::filesystem::is_empty(staging)) << "the temporary file is cleaned up";
}

TEST(TarnPropertyListFileTest, DotDotComponents) {
    EXPECT_TRUE(containsDotDotPathComponents(".."));
    EXPECT_TRUE(containsDotDotPathComponents("a/../b"));
    EXPECT_TRUE(containsDotDotPathComponents("/a/.."));
    EXPECT_FALSE(containsDotDotPathComponents("a/..b/c"));
    EXPECT_FALSE(containsDotDotPathComponents("...//a"));
    EXPECT_FALSE(containsDotDotPathComponents(""));
}

}  // namespace
}  // namespace tarn
