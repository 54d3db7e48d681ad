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

TarnStatus Tarn_writeToURL(const PlistValue& dictionary, const FileURL& url, uint64_t withOptions) {
    std::vector<uint8_t> bytes = dictionary.toBinary();
    if (bytes.empty())
        return formatError(__func__, __LINE__, "Property list could not be serialised");
    return TarnFileManager::defaultManager().writeData(
        std::string(reinterpret_cast<const char*>(bytes.data()), bytes.size()), url, withOptions);
}

TarnResult<PlistValue> Tarn_dictionaryWithContentsOfURL(const FileURL& url, uint64_t options) {
    const std::string bytes =
        TARN_TRY(TarnFileManager::defaultManager().readDataAtURL(url, kMaxPlistBytes));
    std::string why;
    auto value = PlistValue::fromBytes(bytes.data(), bytes.size(), &why);
    if (!value)
        return formatError(__func__, __LINE__,
                           Format("Malformed property list at %@: %@", url, why));
    if (!value->isDict())
        return formatError(__func__, __LINE__,
                           Format("Property list at %@ is not a dictionary", url));
    return std::move(*value);
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
