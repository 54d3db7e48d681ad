#include "Daemon/TarnError.h"

#include <cstring>

namespace tarn {

std::string TarnError::description() const {
    std::string out = Format("Error Domain=%@ Code=%llu", domain_, code_);
    if (description_) out += " \"" + *description_ + "\"";
    out += Format(" UserInfo={FunctionName=%@, SourceFileLine=%d", functionName_, sourceLine_);
    if (underlying_) out += ", UnderlyingError=" + underlying_->description();
    out += "}";
    return out;
}

TarnErrorRef TarnErrorMake(const char* functionName, int line, uint64_t code,
                           TarnErrorRef underlying, bool log,
                           std::optional<std::string> description) {
    const char* fn = functionName ? functionName : "";
    if (description && log) {
        if (underlying) {
            TarnLog(kLogError, fn, "%d: %@ (%@)", line, *description, underlying);
        } else {
            TarnLog(kLogError, fn, "%d: %@", line, *description);
        }
    }
    return std::make_shared<const TarnError>(kTarnErrorDomain, code, std::move(description),
                                             std::move(underlying), fn, line);
}

TarnErrorRef TarnPosixErrorMake(const char* functionName, int line, int err,
                                std::string description) {
    if (description.empty()) description = std::strerror(err);
    return std::make_shared<const TarnError>(kPosixErrorDomain, static_cast<uint64_t>(err),
                                             std::move(description), nullptr,
                                             functionName ? functionName : "", line);
}

}  // namespace tarn
