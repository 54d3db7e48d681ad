// The client side of the upcall: a reply datagram from whatever answers on
// the socket, decoded and its answer buffer read into items (tarnctl upcall,
// tarnrun). Nothing may crash or read outside the bytes.
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "Platform/UpcallQuery.h"
#include "Platform/UpcallSocket.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string why;
    // As a whole reply datagram, then as a bare answer buffer.
    if (auto reply = tarn::upcall::DecodeReplyDatagram({data, size}, &why))
        (void)tarn::upcall::UnpackProcessContainersAnswer(reply->answer, &why);
    std::vector<uint8_t> answer(data, data + size);
    (void)tarn::upcall::UnpackProcessContainersAnswer(answer, &why);
    return 0;
}
