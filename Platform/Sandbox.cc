#include "Platform/Sandbox.h"

#include <fcntl.h>
#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/rand.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <mutex>
#include <vector>

#include "Platform/Path.h"
#include "Platform/RootPrefix.h"

namespace tarn {

namespace {

constexpr size_t kKeyBytes = 32;
constexpr const char* kTokenVersion = "1";

std::string hex(const uint8_t* bytes, size_t n) {
    static const char digits[] = "0123456789abcdef";
    std::string out;
    out.reserve(n * 2);
    for (size_t i = 0; i < n; ++i) {
        out.push_back(digits[bytes[i] >> 4]);
        out.push_back(digits[bytes[i] & 0xf]);
    }
    return out;
}

int readKey(const std::string& path, std::array<uint8_t, kKeyBytes>* key) {
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
    if (fd < 0) return errno;
    ssize_t n = ::read(fd, key->data(), key->size());
    int err = n < 0 ? errno : 0;
    ::close(fd);
    if (err) return err;
    // A short key is a half-written file of a crashed first user; refuse it.
    return n == static_cast<ssize_t>(kKeyBytes) ? 0 : EIO;
}

int makeDirs(const std::string& path) {
    std::string partial;
    for (const auto& component : PathComponents(path)) {
        partial += "/" + component;
        if (::mkdir(partial.c_str(), 0755) != 0 && errno != EEXIST) return errno;
    }
    return 0;
}

// This boot's key: read it, or make it when nobody has yet.
int bootKey(std::array<uint8_t, kKeyBytes>* key) {
    static std::mutex lock;
    std::lock_guard<std::mutex> guard(lock);
    const std::string path = SandboxExtensionKeyPath();
    int err = readKey(path, key);
    if (err != ENOENT) return err;
    if ((err = makeDirs(PathParent(path))) != 0) return err;
    if (RAND_bytes(key->data(), static_cast<int>(key->size())) != 1) return EIO;
    // Written to a private temporary name and linked into place, so a reader
    // never sees a partial key and two daemons never both win.
    std::string tmp = path + ".tmp-XXXXXX";
    int fd = ::mkostemp(tmp.data(), O_CLOEXEC);
    if (fd < 0) return errno;
    (void)::fchmod(fd, 0600);  // mkostemp already makes it 0600
    ssize_t n = ::write(fd, key->data(), key->size());
    err = n == static_cast<ssize_t>(key->size()) ? 0 : (n < 0 ? errno : EIO);
    if (!err && ::fsync(fd) != 0) err = errno;
    ::close(fd);
    if (!err && ::link(tmp.c_str(), path.c_str()) != 0) err = errno;
    (void)::unlink(tmp.c_str());                   // the name under `path` is what counts
    if (err == EEXIST) return readKey(path, key);  // another user made it first
    return err;
}

std::string tokenBody(const std::string& extensionClass, const std::string& path,
                      const SandboxAuditToken& auditToken) {
    return std::string(kTokenVersion) + ";" + extensionClass + ";" +
           hex(reinterpret_cast<const uint8_t*>(path.data()), path.size()) + ";" +
           hex(auditToken.data(), auditToken.size());
}

std::string mac(const std::array<uint8_t, kKeyBytes>& key, const std::string& body) {
    uint8_t out[EVP_MAX_MD_SIZE];
    unsigned int outLength = 0;
    HMAC(EVP_sha256(), key.data(), static_cast<int>(key.size()),
         reinterpret_cast<const unsigned char*>(body.data()), body.size(), out, &outLength);
    return hex(out, outLength);
}

}  // namespace

std::string SandboxExtensionKeyPath() { return RootPath("/run/tarnkeeper/extension-key"); }

std::optional<std::string> SandboxExtensionIssueFile(const std::string& extensionClass,
                                                     const std::string& path,
                                                     const SandboxAuditToken& auditToken,
                                                     int* error) {
    if (extensionClass.empty() || path.empty() || extensionClass.find(';') != std::string::npos) {
        if (error) *error = EINVAL;
        return std::nullopt;
    }
    std::array<uint8_t, kKeyBytes> key{};
    if (int err = bootKey(&key); err != 0) {
        if (error) *error = err;
        return std::nullopt;
    }
    std::string body = tokenBody(extensionClass, path, auditToken);
    return body + ";" + mac(key, body);
}

bool SandboxExtensionVerify(const std::string& token, const std::string& extensionClass,
                            const std::string& path, const SandboxAuditToken& auditToken) {
    const size_t cut = token.rfind(';');
    if (cut == std::string::npos) return false;
    const std::string body = token.substr(0, cut);
    if (body != tokenBody(extensionClass, path, auditToken)) return false;
    std::array<uint8_t, kKeyBytes> key{};
    if (bootKey(&key) != 0) return false;
    const std::string expected = mac(key, body);
    const std::string given = token.substr(cut + 1);
    return given.size() == expected.size() &&
           CRYPTO_memcmp(given.data(), expected.data(), expected.size()) == 0;
}

}  // namespace tarn
