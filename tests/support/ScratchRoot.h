// A scratch root per test: a fresh directory below $TMPDIR (or /tmp) seeded
// like a device root (etc/passwd with "mobile" 501:501 home
// /private/var/mobile, etc/group with "mobile" and "systemusers"), made the
// process's root prefix for the test's lifetime and removed afterwards.
#pragma once

#include <gtest/gtest.h>
#include <unistd.h>

#include <string>

namespace tarn::test {

class ScratchRoot {
public:
    // `activate`: make it the process root prefix (restored on destruction).
    explicit ScratchRoot(bool activate = true);
    ~ScratchRoot();
    ScratchRoot(const ScratchRoot&) = delete;
    ScratchRoot& operator=(const ScratchRoot&) = delete;

    const std::string& path() const { return path_; }
    // `absolute` ("/private/var/...") below this root.
    std::string at(const std::string& absolute) const;
    // Writes a file below the root, creating parent directories.
    void writeFile(const std::string& absolute, const std::string& contents) const;
    void mkdirs(const std::string& absolute) const;

private:
    std::string path_;
    std::string previousRoot_;
    bool activated_;
};

// Base fixture: one scratch root per test.
class ScratchRootTest : public ::testing::Test {
protected:
    ScratchRoot root_;
};

// Skips the current test with a message unless the process runs as root.
#define TARN_REQUIRE_ROOT()                                                          \
    do {                                                                             \
        if (::geteuid() != 0) GTEST_SKIP() << "needs root (owner changes, xattrs)"; \
    } while (0)

}  // namespace tarn::test
