#include "Daemon/TarnPropertyListFile.h"

#include <cstring>

#include "Daemon/TarnFileManager.h"

namespace tarn {

namespace {

TarnErrorRef formatError(const char* function, int line, std::string description) {
    return std::make_shared<const TarnError>(kPlatformErrorDomain, kPlatformErrorPropertyListReadCorrupt,
                                             std::move(description), nullptr, function, line);
}

}  // namespace

bool Tarn_writeToURL(const PlistValue& dictionary, const FileURL& url, uint64_t withOptions,
                     TarnErrorRef* error) {
    std::vector<uint8_t> bytes = dictionary.toBinary();
    if (bytes.empty()) {
        if (error) *error = formatError(__func__, __LINE__, "Property list could not be serialised");
        return false;
    }
    const TarnStatus written = TarnFileManager::defaultManager().writeData(
        std::string(reinterpret_cast<const char*>(bytes.data()), bytes.size()), url, withOptions);
    if (!written.ok() && error) *error = written.error();
    return written.ok();
}

std::optional<PlistValue> Tarn_dictionaryWithContentsOfURL(const FileURL& url, uint64_t options,
                                                           TarnErrorRef* error) {
    auto bytes = TarnFileManager::defaultManager().readDataAtURL(url, kMaxPlistBytes);
    if (!bytes.ok()) {
        if (error) *error = bytes.error();
        return std::nullopt;
    }
    std::string why;
    auto value = PlistValue::fromBytes(bytes->data(), bytes->size(), &why);
    if (!value) {
        if (error) *error = formatError(__func__, __LINE__, Format("Malformed property list at %@: %@", url, why));
        return std::nullopt;
    }
    if (!value->isDict()) {
        if (error) {
            *error = formatError(__func__, __LINE__,
                                 Format("Property list at %@ is not a dictionary", url));
        }
        return std::nullopt;
    }
    return value;
}

bool containsDotDotPathComponents(std::string_view path) {
    size_t start = 0;
    while (start <= path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string_view::npos) end = path.size();
        if (path.substr(start, end - start) == "..") return true;
        start = end + 1;
    }
    return false;
}

std::string stringWithFileSystemRepresentation(const char* bytes) {
    return bytes ? std::string(bytes, std::strlen(bytes)) : std::string();
}

std::string stringWithFileSystemRepresentation(const char* bytes, size_t length) {
    return bytes ? std::string(bytes, length) : std::string();
}

}  // namespace tarn
