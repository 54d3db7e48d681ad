// Kernel upcalls as the socket delivers them: arbitrary bytes taken as one
// datagram from root (the kernel) or from another user, turned into the
// service's message and handed to the message handler, which may find or
// create containers in a scratch root. Whatever the bytes, the daemon
// answers with a well-formed reply to the request's id: an error reply, or a
// success reply whose answer is a pack buffer ending in the status item.
#include <packbuff/packbuff.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <fstream>
#include <vector>

#include "Daemon/TarnKernServer.h"
#include "Platform/PlatformLog.h"
#include "Platform/UpcallSocket.h"
#include "fuzz/FuzzRoot.h"

using namespace tarn;
using namespace tarn::upcall;

namespace {

// A success answer is items ending in the status (uint32, value type 0, 0 or 1).
void checkAnswer(std::vector<uint8_t> answer) {
    sb_packbuff_t* p =
        sb_packbuff_init_with_buffer(answer.data(), answer.size(), true, SB_PACKBUFF_DEALLOC_NONE);
    if (!p) std::abort();
    uint16_t type = 0;
    uint32_t status = 2;
    bool last = false;
    while (sb_packbuff_get_item_value_type(p, &type)) {
        int error = 0;
        if (type == 0) {
            status = sb_packbuff_unpack_uint32(p, &error);
            last = true;
        } else {
            last = false;
            if (sb_packbuff_skip_item(p) != 0) std::abort();
        }
        if (error != 0) std::abort();
    }
    sb_packbuff_free(p);
    if (!last || status > 1) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    PlatformLogSetQuiet(true);
    const std::string dir = fuzz::MakeFuzzRoot("upcall_message_fuzz");
    std::ofstream(dir + "/etc/group", std::ios::app) << "systemusers:x:502:\n";
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0 || size > kMaxRequestDatagram) return 0;
    // The first byte picks the sender, the rest is the datagram.
    const SenderCredentials sender = data[0] & 1
                                         ? SenderCredentials{.uid = 501, .gid = 501, .pid = 4242}
                                         : SenderCredentials{.uid = 0, .gid = 0, .pid = 1};
    std::vector<uint8_t> datagram(data + 1, data + size);
    std::optional<ReceivedMessage> message = DecodeRequestDatagram(datagram, sender);
    if (!message) {
        if (datagram.size() >= kRequestMessageSize &&
            LoadU32(datagram.data() + kOffsetDescriptorSize) <=
                datagram.size() - kRequestMessageSize &&
            LoadU64(datagram.data() + kOffsetDescriptorAddress) == kRequestMessageSize)
            std::abort();  // a region inside the datagram is always delivered
        return 0;
    }
    ReplyMessage reply;
    const bool handled = demux_server(*message, &reply);
    const uint32_t id = LoadU32(message->bytes.data() + kOffsetID);
    if (handled != (id == kProcessContainersRequestID)) std::abort();
    if (!handled) return 0;

    std::string why;
    std::optional<DecodedReply> decoded = DecodeReplyDatagram(EncodeReplyDatagram(reply), &why);
    if (!decoded || decoded->id != static_cast<int32_t>(id + kReplyIDOffset)) std::abort();
    if (decoded->returnCode == 0) {
        // Only the kernel gets an answer.
        if (sender.uid != 0) std::abort();
        checkAnswer(std::move(decoded->answer));
    }
    return 0;
}
