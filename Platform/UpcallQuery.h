// The process-container query as a client sends it (tarnctl, tarnrun, tests):
// the request pack buffer built from typed fields, and the answer pack buffer
// read back into items. The framing is UpcallSocket.h's.
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <variant>
#include <vector>

namespace tarn::upcall {

struct ProcessContainersQuery {
    uint32_t uid = 0;
    std::optional<uint32_t> persona;  // absent: none
    std::optional<std::string> codeSigningID;
    std::optional<std::string> containerID;
    std::optional<uint32_t> containerType;  // 0 application, 1 plug-in
    std::vector<std::string> appGroups;
    std::optional<std::string> systemContainer;
    std::vector<std::string> systemGroups;
};

// Answer item types.
enum AnswerType : uint16_t {
    kAnswerStatus = 0,
    kAnswerDataContainer = 1,
    kAnswerTemporaryDirectory = 2,
    kAnswerAppGroup = 3,  // key: group identifier, value: its path
    kAnswerHomeDirectory = 100,
    kAnswerSystemContainer = 101,
    kAnswerSystemGroup = 102,  // key: group identifier, value: its path
};

struct AnswerItem {
    uint16_t type = 0;  // for a group: the key's type (3 or 102)
    std::optional<std::string> key;
    std::variant<uint32_t, std::string> value;
};

// The request buffer's bytes, items in value-type order; nullopt when
// packing failed.
std::optional<std::vector<uint8_t>> PackProcessContainersQuery(const ProcessContainersQuery& query);

// The items of an answer buffer in order; nullopt (reason in *why) when the
// buffer cannot be read. `answer` is wrapped in place, never reallocated.
std::optional<std::vector<AnswerItem>> UnpackProcessContainersAnswer(std::vector<uint8_t>& answer,
                                                                     std::string* why);

struct ProcessContainersAnswer {
    int32_t returnCode = 0;
    std::vector<AnswerItem> items;
};

// How a round trip failed, for callers that tell these apart.
enum class QueryFailure { kNone, kBadQuery, kUnreachable, kNoReply };

// Sends `query` on the upcall socket `socketPath` and reads the answer.
std::optional<ProcessContainersAnswer> QueryProcessContainers(const std::string& socketPath,
                                                              const ProcessContainersQuery& query,
                                                              std::chrono::milliseconds timeout,
                                                              QueryFailure* failure,
                                                              std::string* why);

}  // namespace tarn::upcall
