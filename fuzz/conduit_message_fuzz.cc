// Feeds arbitrary bytes to the Conduit decoders the daemon runs on peer input:
// the record assembler (input split into records by a length prefix) and the
// body decoder. Whatever decodes must encode again and decode to the same value.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <vector>

#include "Platform/ConduitWire.h"

using namespace tarn::conduit;

namespace {

void checkBody(const uint8_t* data, size_t size) {
    std::string why;
    auto value = DecodeBody(data, size, &why);
    if (!value) return;
    std::vector<uint8_t> again;
    if (!EncodeBody(*value, &again, &why)) std::abort();
    auto back = DecodeBody(again.data(), again.size(), &why);
    if (!back || !(*back == *value)) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    checkBody(data, size);

    // The same bytes as a stream of records: two length bytes, then the record.
    RecordAssembler assembler;
    size_t pos = 0;
    while (size - pos >= 2) {
        const size_t n = std::min<size_t>(size_t{data[pos]} | (size_t{data[pos + 1]} << 8),
                                          size - pos - 2);
        pos += 2;
        std::string why;
        const auto r = assembler.add(data + pos, n, &why);
        pos += n;
        if (r == RecordAssembler::Result::Malformed) break;
        if (r == RecordAssembler::Result::Complete) {
            std::vector<uint8_t> body = assembler.take();
            checkBody(body.data(), body.size());
        }
    }
    return 0;
}
