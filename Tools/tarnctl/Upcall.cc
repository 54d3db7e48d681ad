// `tarnctl upcall`: sends one kernel upcall (the process-container query) on
// the daemon's upcall socket and prints the answer as one JSON object:
//   {"ReturnCode": N, "Items": [{"Type": T, "Value": V}, ...]}
// An item is a string or a number; a key with a string value (answer types 3
// and 102, group identifier and its path) is {"Type": T, "Key": K, "Value": V}
// with the key's type. Only a process running as root is answered as the kernel.
#include <packbuff/packbuff.h>

#include <cstring>
#include <iostream>
#include <memory>
#include <span>
#include <string>
#include <vector>

#include "Platform/Format.h"
#include "Platform/Path.h"
#include "Platform/PropertyList.h"
#include "Platform/RootPrefix.h"
#include "Platform/UpcallSocket.h"
#include "Tools/tarnctl/Json.h"
#include "Tools/tarnctl/Subcommands.h"

namespace tarnctl {

namespace {

struct UpcallArguments {
    uint32_t uid = 0;
    std::optional<uint32_t> persona;
    std::optional<std::string> codeSigningID;
    std::optional<std::string> containerID;
    std::optional<uint32_t> containerType;
    std::vector<std::string> appGroups;
    std::optional<std::string> systemContainer;
    std::vector<std::string> systemGroups;
};

// Answer value types whose string is the key of the next one.
bool isKeyType(uint16_t valueType) { return valueType == 3 || valueType == 102; }

struct PackbuffFree {
    void operator()(sb_packbuff_t* p) const { sb_packbuff_free(p); }
};
using PackbuffPtr = std::unique_ptr<sb_packbuff_t, PackbuffFree>;

// The request buffer's bytes, items in value-type order; empty when packing failed.
std::optional<std::vector<uint8_t>> packRequest(const UpcallArguments& a) {
    PackbuffPtr p(sb_packbuff_new(0));
    if (!p) return std::nullopt;
    int error = 0;
    auto string = [&](uint16_t type, const std::string& s) {
        if (error == 0) error = sb_packbuff_pack_string(p.get(), type, s.c_str(), s.size());
    };
    auto number = [&](uint16_t type, uint32_t v) {
        if (error == 0) error = sb_packbuff_pack_uint32(p.get(), type, v);
    };
    if (a.codeSigningID) string(0, *a.codeSigningID);
    if (a.containerID) string(1, *a.containerID);
    number(3, a.uid);
    for (const std::string& g : a.appGroups) string(4, g);
    if (a.containerType) number(5, *a.containerType);
    if (a.systemContainer) string(6, *a.systemContainer);
    for (const std::string& g : a.systemGroups) string(7, g);
    if (a.persona) number(8, *a.persona);
    if (error != 0) return std::nullopt;
    const auto* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(p.get()));
    return std::vector<uint8_t>(bytes, bytes + sb_packbuff_get_size(p.get()));
}

// The answer's items as JSON values; empty when the buffer cannot be read.
std::optional<tarn::PlistArray> answerItems(std::vector<uint8_t>& answer, std::string* why) {
    tarn::PlistArray items;
    if (answer.empty()) return items;
    PackbuffPtr p(
        sb_packbuff_init_with_buffer(answer.data(), answer.size(), true, SB_PACKBUFF_DEALLOC_NONE));
    if (!p) {
        *why = "answer is not a pack buffer";
        return std::nullopt;
    }
    uint16_t type = 0;
    while (sb_packbuff_get_item_value_type(p.get(), &type)) {
        tarn::PlistValue item{tarn::PlistDict{}};
        item.set("Type", uint64_t{type});
        int error = 0;
        uint16_t kind = 0;  // the item type leads the item's header
        std::memcpy(&kind, p->item, sizeof kind);
        if (kind == SB_PACKBUFF_ITEM_UINT32) {
            item.set("Value", uint64_t{sb_packbuff_unpack_uint32(p.get(), &error)});
        } else if (kind == SB_PACKBUFF_ITEM_STRING && isKeyType(type)) {
            const char* key = nullptr;
            const char* value = nullptr;
            uint16_t valueType = 0;
            error = sb_packbuff_unpack_key_with_string_value(p.get(), &key, &valueType, &value,
                                                             nullptr);
            if (error == 0) {
                item.set("Key", std::string(key));
                item.set("Value", std::string(value));
            }
        } else if (kind == SB_PACKBUFF_ITEM_STRING) {
            const char* value = sb_packbuff_unpack_string(p.get(), nullptr, &error);
            if (error == 0) item.set("Value", std::string(value));
        } else {
            error = SB_PACKBUFF_EINVAL;
        }
        if (error != 0) {
            *why = tarn::Format("answer item %zu cannot be read: error %d", items.size(), error);
            return std::nullopt;
        }
        items.push_back(std::move(item));
    }
    return items;
}

std::string upcallSocketPath(const Options& options) {
    if (!options.socket.empty())
        return tarn::PathJoin(tarn::PathParent(options.socket),
                              std::string(tarn::upcall::kUpcallServiceName) + ".socket");
    tarn::SetRootPrefix(options.root.empty() ? "/" : options.root);
    return tarn::upcall::UpcallSocketPath();
}

void runUpcall(Options& options, const UpcallArguments& arguments) {
    std::optional<std::vector<uint8_t>> request = packRequest(arguments);
    if (!request) {
        std::cerr << "tarnctl: the request cannot be packed\n";
        options.exitCode = kExitBadInput;
        return;
    }
    std::string why;
    auto client = tarn::upcall::UpcallClient::connect(upcallSocketPath(options), &why);
    if (!client) {
        std::cerr << "tarnctl: cannot reach the daemon: " << why << "\n";
        options.exitCode = kExitUnavailable;
        return;
    }
    const std::vector<uint8_t> datagram = tarn::upcall::EncodeRequestDatagram(*request);
    std::optional<std::vector<uint8_t>> bytes = client->call(datagram, options.timeout(), &why);
    std::optional<tarn::upcall::DecodedReply> reply;
    if (bytes) reply = tarn::upcall::DecodeReplyDatagram(*bytes, &why);
    std::optional<tarn::PlistArray> items;
    if (reply) items = answerItems(reply->answer, &why);
    if (!items) {
        std::cerr << "tarnctl: no reply: " << why << "\n";
        options.exitCode = kExitNoReply;
        return;
    }
    tarn::PlistValue out{tarn::PlistDict{}};
    out.set("ReturnCode", reply->returnCode < 0 ? tarn::PlistValue(int64_t{reply->returnCode})
                                                : tarn::PlistValue(uint64_t(reply->returnCode)));
    out.set("Items", std::move(*items));
    std::cout << PlistToJson(out) << "\n";
}

}  // namespace

void SetupUpcallCommand(CLI::App& app, Options& options) {
    auto* cmd = app.add_subcommand(
        "upcall",
        "Send one kernel upcall (process-container query) and print {\"ReturnCode\": N, "
        "\"Items\": [...]}; an item is {\"Type\", \"Value\"}, or {\"Type\", \"Key\", \"Value\"} "
        "for a group and its path (Type is the key's, 3 or 102)");
    static UpcallArguments arguments;
    cmd->add_option("--uid", arguments.uid, "User id of the process")->required();
    cmd->add_option("--persona", arguments.persona, "Kernel persona id (default: none)");
    cmd->add_option("--code-signing-id", arguments.codeSigningID, "Code-signing identifier");
    cmd->add_option("--container-id", arguments.containerID, "Data container identifier");
    cmd->add_option("--container-type", arguments.containerType, "0 application, 1 plug-in")
        ->check(CLI::Range(0, 1));
    cmd->add_option("--app-group", arguments.appGroups, "Application group (repeatable)")
        ->expected(1)
        ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll);
    cmd->add_option("--system-container", arguments.systemContainer, "System container identifier");
    cmd->add_option("--system-group", arguments.systemGroups, "System group (repeatable)")
        ->expected(1)
        ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll);
    cmd->callback([&options] { runUpcall(options, arguments); });
}

}  // namespace tarnctl
