#include "Platform/UpcallQuery.h"

#include <packbuff/packbuff.h>

#include <cstring>
#include <memory>

#include "Platform/Format.h"
#include "Platform/UpcallSocket.h"

namespace tarn::upcall {

namespace {

struct PackbuffFree {
    void operator()(sb_packbuff_t* p) const { sb_packbuff_free(p); }
};
using PackbuffPtr = std::unique_ptr<sb_packbuff_t, PackbuffFree>;

// Answer value types whose string is the key of the next one.
bool isKeyType(uint16_t valueType) {
    return valueType == kAnswerAppGroup || valueType == kAnswerSystemGroup;
}

}  // namespace

std::optional<std::vector<uint8_t>> PackProcessContainersQuery(const ProcessContainersQuery& q) {
    PackbuffPtr p(sb_packbuff_new(0));
    if (!p) return std::nullopt;
    int error = 0;
    auto string = [&](uint16_t type, const std::string& s) {
        if (error == 0) error = sb_packbuff_pack_string(p.get(), type, s.c_str(), s.size());
    };
    auto number = [&](uint16_t type, uint32_t v) {
        if (error == 0) error = sb_packbuff_pack_uint32(p.get(), type, v);
    };
    if (q.codeSigningID) string(0, *q.codeSigningID);
    if (q.containerID) string(1, *q.containerID);
    number(3, q.uid);
    for (const std::string& g : q.appGroups) string(4, g);
    if (q.containerType) number(5, *q.containerType);
    if (q.systemContainer) string(6, *q.systemContainer);
    for (const std::string& g : q.systemGroups) string(7, g);
    if (q.persona) number(8, *q.persona);
    if (error != 0) return std::nullopt;
    const auto* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(p.get()));
    return std::vector<uint8_t>(bytes, bytes + sb_packbuff_get_size(p.get()));
}

std::optional<std::vector<AnswerItem>> UnpackProcessContainersAnswer(std::vector<uint8_t>& answer,
                                                                     std::string* why) {
    std::vector<AnswerItem> items;
    if (answer.empty()) return items;
    PackbuffPtr p(
        sb_packbuff_init_with_buffer(answer.data(), answer.size(), true, SB_PACKBUFF_DEALLOC_NONE));
    if (!p) {
        *why = "answer is not a pack buffer";
        return std::nullopt;
    }
    uint16_t type = 0;
    while (sb_packbuff_get_item_value_type(p.get(), &type)) {
        AnswerItem item;
        item.type = type;
        int error = 0;
        uint16_t kind = 0;  // the item type leads the item's header
        std::memcpy(&kind, p->item, sizeof kind);
        if (kind == SB_PACKBUFF_ITEM_UINT32) {
            item.value = sb_packbuff_unpack_uint32(p.get(), &error);
        } else if (kind == SB_PACKBUFF_ITEM_STRING && isKeyType(type)) {
            const char* key = nullptr;
            const char* value = nullptr;
            uint16_t valueType = 0;
            error = sb_packbuff_unpack_key_with_string_value(p.get(), &key, &valueType, &value,
                                                             nullptr);
            if (error == 0) {
                item.key = std::string(key);
                item.value = std::string(value);
            }
        } else if (kind == SB_PACKBUFF_ITEM_STRING) {
            const char* value = sb_packbuff_unpack_string(p.get(), nullptr, &error);
            if (error == 0) item.value = std::string(value);
        } else {
            error = SB_PACKBUFF_EINVAL;
        }
        if (error != 0) {
            *why = Format("answer item %zu cannot be read: error %d", items.size(), error);
            return std::nullopt;
        }
        items.push_back(std::move(item));
    }
    return items;
}

std::optional<ProcessContainersAnswer> QueryProcessContainers(const std::string& socketPath,
                                                              const ProcessContainersQuery& query,
                                                              std::chrono::milliseconds timeout,
                                                              QueryFailure* failure,
                                                              std::string* why) {
    std::optional<std::vector<uint8_t>> request = PackProcessContainersQuery(query);
    if (!request) {
        *failure = QueryFailure::kBadQuery;
        *why = "the request cannot be packed";
        return std::nullopt;
    }
    auto client = UpcallClient::connect(socketPath, why);
    if (!client) {
        *failure = QueryFailure::kUnreachable;
        return std::nullopt;
    }
    *failure = QueryFailure::kNoReply;
    std::optional<std::vector<uint8_t>> bytes =
        client->call(EncodeRequestDatagram(*request), timeout, why);
    if (!bytes) return std::nullopt;
    std::optional<DecodedReply> reply = DecodeReplyDatagram(*bytes, why);
    if (!reply) return std::nullopt;
    std::optional<std::vector<AnswerItem>> items =
        UnpackProcessContainersAnswer(reply->answer, why);
    if (!items) return std::nullopt;
    *failure = QueryFailure::kNone;
    return ProcessContainersAnswer{reply->returnCode, std::move(*items)};
}

}  // namespace tarn::upcall
