// What the crash-trial writer puts into the agent's four persisted stores for generation N,
// shared by the writer program and the test that kills it: the test recognises each file's
// generation and checks the whole content against it. Stateless.
#pragma once

#include <cstdint>
#include <string>

#include "core/Value.h"

namespace qax::test::crashtrial {

inline constexpr const char* kSerialNumber = "CRASH-TRIAL-SN";
inline constexpr const char* kPreferenceKey = "CrashTrial";
inline constexpr const char* kGenerationKey = "Generation";
inline constexpr const char* kPayloadKey = "Payload";
inline constexpr const char* kFollowUpClient = "com.velmora.Kestova";
inline constexpr const char* kFollowUpIdentifier = "com.velmora.Kestova.crash-trial";
inline constexpr const char* kActivityIdentifier = "com.velmora.crash-trial";

// Between 200 bytes and 4 KB, different for neighbouring generations, so a file that mixed
// two writes would not match either.
inline std::string payload(std::int64_t generation) {
    const std::size_t size = 200 + static_cast<std::size_t>((generation * 7919) % 3900);
    std::string text(size, static_cast<char>('a' + generation % 26));
    text += "#" + std::to_string(generation);
    return text;
}

// The coverage summary cached for the trial's serial number.
inline Value summary(std::int64_t generation) {
    return Value::Dictionary{{"covered", Value(true)},
                             {"hvOfferIdentifier", Value("G" + std::to_string(generation))},
                             {"coverageLocalizedDesc", Value(payload(generation))},
                             {kGenerationKey, Value(generation)}};
}

}  // namespace qax::test::crashtrial
