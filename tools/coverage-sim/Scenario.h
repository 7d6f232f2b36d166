// What coverage-sim answers next: per key (a serial number, "*" for any serial number
// without its own list, "@versions", "@token", "@lookup", "@purchases" for the other
// endpoints) a list of answers consumed one per request; once a list is used up the
// normal answer is given again. Thread-safe (one mutex); handlers take steps concurrently
// while the admin endpoint replaces lists.
#pragma once

#include <cstddef>
#include <deque>
#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "core/Value.h"

namespace coveragesim {

// One answer. Text forms (what the scenario file, --answer and the admin endpoint take):
//   "ok" | "200"      the normal answer
//   "NNN"             that HTTP status with a small JSON error body (100-599)
//   "delay MS [STEP]" wait MS milliseconds, then STEP (the normal answer when absent)
//   "garbage"         200 with a body that is neither JSON nor a property list
//   "html"            200 with an HTML page (text/html), as a captive portal answers
//   "array"           200 with an array where a dictionary is expected
//   "deep [LEVELS]"   200 with arrays nested LEVELS deep (default 100000)
//   "huge [BYTES]"    200 with a body of BYTES (default 64 MiB), streamed
//   "hang"            no answer until the client goes away
//   "reset [BYTES]"   the connection is reset without an answer, or, with BYTES, after the
//                     headers and the first BYTES of a body announced twice as long
struct ScenarioStep {
    enum class Kind { Normal, Status, Garbage, Html, Array, Deep, Huge, Hang, Reset };
    Kind kind = Kind::Normal;
    int delayMs = 0;
    int status = 200;
    std::size_t size = 0;  // levels of "deep", bytes of "huge" and of "reset" before the reset
    std::string text;      // the step as written, normalised

    // None with `error` set when the text is not a step.
    static std::optional<ScenarioStep> parse(const std::string& text, std::string* error);
    // A step as a JSON value: a string, or an integer status.
    static std::optional<ScenarioStep> fromValue(const qax::Value& value, std::string* error);
};

class Scenario {
  public:
    // Replaces the lists of the keys in `lists` ({"KEY": [step, ...]} or {"KEY": step});
    // an empty list removes the key. Nothing changes when any step does not parse.
    bool set(const qax::Value& lists, std::string* error);
    // Appends "KEY=STEP,STEP,..." (the --answer form) to that key's list.
    bool append(const std::string& keyAndSteps, std::string* error);
    void clear();

    // The next step for `key`, removed from its list; none when the list is empty.
    std::optional<ScenarioStep> next(const std::string& key);
    // For a serial number: its own list first, then "*".
    std::optional<ScenarioStep> nextForSerial(const std::string& serialNumber);

    // The steps still to come, {"KEY": ["step", ...]}.
    qax::Value remaining() const;

  private:
    mutable std::mutex mutex_;
    std::map<std::string, std::deque<ScenarioStep>> lists_;
};

}  // namespace coveragesim
