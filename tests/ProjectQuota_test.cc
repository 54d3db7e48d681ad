// Container sizing by project quota: on a file system that keeps project
// usage the answer is the project's and matches the walk; anywhere else (or
// when the tree left its project) the walk answers as before. The project id
// lives in the metadata, and a bad one there costs only the fast answer.
#include "Platform/ProjectQuota.h"

#include <gtest/gtest.h>
#include <sys/mount.h>

#include <filesystem>
#include <fstream>
#include <string>

#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/HostConfiguration.h"
#include "support/DaemonHarness.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

class ProjectQuotaTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        HostConfiguration config;
        config.featureFlags["fast_container_sizing"] = true;
        HostConfiguration::TEST_setShared(config);
    }
    void TearDown() override { HostConfiguration::TEST_setShared(HostConfiguration{}); }

    void fill(const std::string& directory) {
        fs::create_directories(directory + "/Library/Caches");
        std::ofstream(directory + "/big") << std::string(300000, 'x');
        for (int i = 0; i < 20; ++i)
            std::ofstream(directory + "/Library/Caches/" + std::to_string(i)) << "cached";
    }

    TarnFileManager& fm_ = TarnFileManager::defaultManager();
};

TEST_F(ProjectQuotaTest, WithoutProjectUsageNoIdIsGivenAndTheWalkAnswers) {
    const std::string container = root_.at("/c");
    fs::create_directories(container);
    const Uuid uuid = Uuid::generate();
    ProjectQuotaUsage usage;
    if (ProjectQuotaUsageOf(container, 1u << 16, &usage) == 0)
        GTEST_SKIP() << "the scratch file system keeps project usage; the loop test covers it";

    EXPECT_EQ(fm_.assignProjectToNewContainer(container, uuid), std::nullopt);
    fill(container);
    const uint64_t walked = fm_.diskUsageForURL(container);
    EXPECT_GT(walked, 300000u);
    EXPECT_EQ(fm_.fastDiskUsageForURL(container, /*projectID=*/70000), walked);
}

TEST_F(ProjectQuotaTest, ProjectIdIsKeptInTheMetadataAndABadOneIsIgnored) {
    TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
    const TarnUserIdentityRef mobile = TarnUserIdentityCache::defaultUserIdentity();
    const Uuid uuid = Uuid::generate();
    const FileURL dir =
        PathJoin(*TarnGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
                     mobile, 2, false),
                 uuid.string());
    fs::create_directories(dir);
    auto identity =
        TarnConcreteContainerIdentity::containerIdentityWithUUID(uuid, mobile, "com.ostrea.app", 2)
            .value();
    TarnMutableMetadataRef metadata =
        TarnMetadata::initWithContainerIdentity(identity, std::nullopt, dir, std::nullopt);

    for (const std::optional<uint32_t> projectID :
         {std::optional<uint32_t>(70001), std::optional<uint32_t>()}) {
        metadata->setProjectID(projectID);
        // Written even where the file system has no project ids.
        ASSERT_TRUE(metadata->writeMetadataToDiskWithError().ok());
        auto read = TarnMetadata::readAndValidateMetadataAtUrl(dir, mobile, true);
        ASSERT_TRUE(read.ok());
        EXPECT_EQ((*read)->projectID(), projectID);
    }

    for (const PlistValue& bad : {PlistValue("70002"), PlistValue(int64_t{-1}),
                                  PlistValue(uint64_t{0}), PlistValue(uint64_t{1} << 40)}) {
        PlistValue dictionary = metadata->dictionaryRepresentation();
        dictionary.set(kTarnMetadataProjectIDKey, bad);
        auto bytes = dictionary.toBinary();
        std::ofstream(PathJoin(dir, kTarnMetadataFileName), std::ios::binary | std::ios::trunc)
            .write(reinterpret_cast<const char*>(bytes.data()),
                   static_cast<std::streamsize>(bytes.size()));
        auto read = TarnMetadata::readAndValidateMetadataAtUrl(dir, mobile, true);
        ASSERT_TRUE(read.ok()) << bad.description();
        EXPECT_EQ((*read)->projectID(), std::nullopt) << bad.description();
    }
    TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
}

// `name` in the system directories, or "" (spawning wants a path).
std::string systemProgram(const std::string& name) {
    for (const char* directory : {"/usr/sbin", "/sbin", "/usr/bin", "/bin"})
        if (fs::exists(std::string(directory) + "/" + name))
            return std::string(directory) + "/" + name;
    return "";
}

// An ext4 image with project quotas, loop-mounted in the scratch root.
class ProjectQuotaLoopTest : public ProjectQuotaTest {
  protected:
    void SetUp() override {
        ProjectQuotaTest::SetUp();
        if (::geteuid() != 0) GTEST_SKIP() << "needs root to loop-mount an ext4 image";
        const std::string image = root_.at("/ext4.img");
        mountPoint_ = root_.at("/mnt");
        fs::create_directories(mountPoint_);
        std::ofstream(image).close();
        fs::resize_file(image, 64 << 20);
        const std::string mkfs = systemProgram("mkfs.ext4"), mount = systemProgram("mount");
        if (mkfs.empty() || mount.empty()) GTEST_SKIP() << "needs mkfs.ext4 and mount";
        const test::ProcessResult made = test::RunProcess(
            {mkfs, "-q", "-F", "-O", "project,quota", "-E", "quotatype=prjquota", image});
        if (made.exitCode != 0)
            GTEST_SKIP() << "mkfs.ext4 cannot make an image with project quotas: " << made.err;
        const test::ProcessResult mounted =
            test::RunProcess({mount, "-o", "loop,prjquota", image, mountPoint_});
        if (mounted.exitCode != 0) {
            // The kernel says why only in its log.
            const test::ProcessResult log = test::RunProcess(
                {"/bin/sh", "-c", "dmesg 2>/dev/null | grep -i -E 'quota|EXT4-fs' | tail -n 1"});
            std::string why = log.out.empty() ? mounted.err : log.out;
            while (!why.empty() && why.back() == '\n') why.pop_back();
            GTEST_SKIP() << "cannot mount an ext4 image with project quotas (" << why
                         << "); this kernel needs CONFIG_QUOTA and CONFIG_QFMT_V2";
        }
        mounted_ = true;
    }
    void TearDown() override {
        // Lazily, so a test that failed with a file open still lets go; the
        // loop device of "-o loop" goes with the mount.
        if (mounted_) (void)::umount2(mountPoint_.c_str(), MNT_DETACH);
        ProjectQuotaTest::TearDown();
    }

    std::string mountPoint_;
    bool mounted_ = false;
};

TEST_F(ProjectQuotaLoopTest, NewContainerIsSizedByItsProjectLikeTheWalk) {
    const std::string container = mountPoint_ + "/container";
    fs::create_directories(container);
    const std::optional<uint32_t> projectID =
        fm_.assignProjectToNewContainer(container, Uuid::generate());
    ASSERT_TRUE(projectID);
    fill(container);

    // Everything made below inherits the project.
    uint32_t cachesProject = 0;
    bool inherits = false;
    ASSERT_EQ(ProjectQuotaRead(container + "/Library/Caches", &cachesProject, &inherits), 0);
    EXPECT_EQ(cachesProject, *projectID);
    EXPECT_TRUE(inherits);

    ::sync();  // delayed allocation: charge the blocks before comparing
    const uint64_t walked = fm_.diskUsageForURL(container);
    EXPECT_EQ(fm_.fastDiskUsageForURL(container, projectID), walked);
    // A second container gets another project, and the first one's figure
    // does not move.
    const std::string second = mountPoint_ + "/second";
    fs::create_directories(second);
    const std::optional<uint32_t> secondID =
        fm_.assignProjectToNewContainer(second, Uuid::generate());
    ASSERT_TRUE(secondID);
    EXPECT_NE(*secondID, *projectID);
    std::ofstream(second + "/other") << std::string(100000, 'y');
    ::sync();
    EXPECT_EQ(fm_.fastDiskUsageForURL(container, projectID), walked);
    // A tree not in the project it is asked about is walked.
    EXPECT_EQ(fm_.fastDiskUsageForURL(container, secondID), walked);
}

}  // namespace
}  // namespace tarn
