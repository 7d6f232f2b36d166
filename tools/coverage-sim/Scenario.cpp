#include "Scenario.h"

#include <charconv>
#include <sstream>
#include <vector>

namespace coveragesim {
namespace {

using qax::Value;

constexpr std::size_t kDefaultDeepLevels = 100000;
constexpr std::size_t kDefaultHugeBytes = 64 * 1024 * 1024;
constexpr std::size_t kMaxHugeBytes = 1024ull * 1024 * 1024;
constexpr std::size_t kMaxDeepLevels = 10'000'000;
constexpr long long kMaxDelayMs = 3'600'000;

std::optional<long long> number(const std::string& word) {
    long long n = 0;
    auto [end, ec] = std::from_chars(word.data(), word.data() + word.size(), n);
    if (ec != std::errc() || end != word.data() + word.size() || n < 0) {
        return std::nullopt;
    }
    return n;
}

bool fail(std::string* error, const std::string& why) {
    if (error) {
        *error = why;
    }
    return false;
}

std::optional<ScenarioStep> parseWords(const std::vector<std::string>& words, std::size_t at,
                                       const std::string& whole, std::string* error) {
    ScenarioStep step;
    auto bad = [&](const std::string& why) -> std::optional<ScenarioStep> {
        fail(error, "'" + whole + "': " + why);
        return std::nullopt;
    };
    if (at == words.size()) {
        return step;  // "delay N" alone: the normal answer afterwards
    }
    const std::string& word = words[at];
    const bool hasArgument = at + 1 < words.size();
    auto argument = [&](std::size_t fallback, std::size_t limit) -> std::optional<std::size_t> {
        if (!hasArgument) {
            return fallback;
        }
        auto n = number(words[at + 1]);
        if (!n || *n == 0 || static_cast<std::size_t>(*n) > limit || at + 2 != words.size()) {
            return std::nullopt;
        }
        return static_cast<std::size_t>(*n);
    };
    if (word == "delay") {
        auto ms = hasArgument ? number(words[at + 1]) : std::nullopt;
        if (!ms || *ms > kMaxDelayMs) {
            return bad("delay takes milliseconds (at most 3600000)");
        }
        auto rest = parseWords(words, at + 2, whole, error);
        if (rest) {
            rest->delayMs += static_cast<int>(*ms);
        }
        return rest;
    }
    if (word == "ok" || word == "garbage" || word == "html" || word == "array" || word == "hang") {
        if (hasArgument) {
            return bad("'" + word + "' takes no argument");
        }
        step.kind = word == "ok"        ? ScenarioStep::Kind::Normal
                    : word == "garbage" ? ScenarioStep::Kind::Garbage
                    : word == "html"    ? ScenarioStep::Kind::Html
                    : word == "array"   ? ScenarioStep::Kind::Array
                                        : ScenarioStep::Kind::Hang;
        return step;
    }
    if (word == "reset") {
        auto size = argument(0, kMaxHugeBytes);
        if (!size) {
            return bad("reset takes the byte count of the body sent before it");
        }
        step.kind = ScenarioStep::Kind::Reset;
        step.size = *size;
        return step;
    }
    if (word == "deep" || word == "huge") {
        const bool deep = word == "deep";
        auto size = deep ? argument(kDefaultDeepLevels, kMaxDeepLevels)
                         : argument(kDefaultHugeBytes, kMaxHugeBytes);
        if (!size) {
            return bad(deep ? "deep takes a level count" : "huge takes a byte count (up to 1 GiB)");
        }
        step.kind = deep ? ScenarioStep::Kind::Deep : ScenarioStep::Kind::Huge;
        step.size = *size;
        return step;
    }
    if (auto status = number(word); status && !hasArgument) {
        if (*status < 100 || *status > 599) {
            return bad("an HTTP status is between 100 and 599");
        }
        if (*status != 200) {
            step.kind = ScenarioStep::Kind::Status;
            step.status = static_cast<int>(*status);
        }
        return step;
    }
    return bad(
        "not an answer (ok, an HTTP status, delay MS [STEP], garbage, html, array, deep [LEVELS], "
        "huge [BYTES], hang, reset [BYTES])");
}

}  // namespace

std::optional<ScenarioStep> ScenarioStep::parse(const std::string& text, std::string* error) {
    std::istringstream in(text);
    std::vector<std::string> words;
    for (std::string w; in >> w;) {
        for (char& c : w) {
            c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
        }
        words.push_back(w);
    }
    if (words.empty()) {
        fail(error, "an empty answer");
        return std::nullopt;
    }
    auto step = parseWords(words, 0, text, error);
    if (step) {
        std::string normalised;
        for (const auto& w : words) {
            normalised += (normalised.empty() ? "" : " ") + w;
        }
        step->text = normalised;
    }
    return step;
}

std::optional<ScenarioStep> ScenarioStep::fromValue(const Value& value, std::string* error) {
    if (auto s = value.asString()) {
        return parse(*s, error);
    }
    if (value.isInteger()) {
        return parse(std::to_string(*value.asInteger()), error);
    }
    fail(error, std::string("an answer is a string or an HTTP status, not ") +
                    Value::kindName(value.kind()));
    return std::nullopt;
}

bool Scenario::set(const Value& lists, std::string* error) {
    const Value::Dictionary* keys = lists.asDictionary();
    if (!keys) {
        return fail(error, "a scenario is an object: {\"SERIAL\": [\"401\", \"ok\"], ...}");
    }
    std::map<std::string, std::deque<ScenarioStep>> parsed;
    for (const auto& [key, value] : *keys) {
        if (key.empty()) {
            return fail(error, "an empty key");
        }
        auto& list = parsed[key];
        const Value::Array single{value};
        const Value::Array* steps = value.isArray() ? value.asArray() : &single;
        for (const auto& v : *steps) {
            auto step = ScenarioStep::fromValue(v, error);
            if (!step) {
                return false;
            }
            list.push_back(std::move(*step));
        }
    }
    std::lock_guard lock(mutex_);
    for (auto& [key, list] : parsed) {
        if (list.empty()) {
            lists_.erase(key);
        } else {
            lists_[key] = std::move(list);
        }
    }
    return true;
}

bool Scenario::append(const std::string& keyAndSteps, std::string* error) {
    const auto eq = keyAndSteps.find('=');
    if (eq == std::string::npos || eq == 0) {
        return fail(error, "'" + keyAndSteps + "' is not KEY=STEP[,STEP...]");
    }
    std::deque<ScenarioStep> steps;
    std::istringstream in(keyAndSteps.substr(eq + 1));
    for (std::string text; std::getline(in, text, ',');) {
        auto step = ScenarioStep::parse(text, error);
        if (!step) {
            return false;
        }
        steps.push_back(std::move(*step));
    }
    std::lock_guard lock(mutex_);
    auto& list = lists_[keyAndSteps.substr(0, eq)];
    list.insert(list.end(), steps.begin(), steps.end());
    return true;
}

void Scenario::clear() {
    std::lock_guard lock(mutex_);
    lists_.clear();
}

std::optional<ScenarioStep> Scenario::next(const std::string& key) {
    std::lock_guard lock(mutex_);
    auto it = lists_.find(key);
    if (it == lists_.end()) {
        return std::nullopt;
    }
    ScenarioStep step = std::move(it->second.front());
    it->second.pop_front();
    if (it->second.empty()) {
        lists_.erase(it);
    }
    return step;
}

std::optional<ScenarioStep> Scenario::nextForSerial(const std::string& serialNumber) {
    if (auto step = next(serialNumber)) {
        return step;
    }
    return next("*");
}

Value Scenario::remaining() const {
    std::lock_guard lock(mutex_);
    Value::Dictionary out;
    for (const auto& [key, list] : lists_) {
        Value::Array steps;
        for (const auto& s : list) {
            steps.push_back(Value(s.text));
        }
        out[key] = Value(std::move(steps));
    }
    return Value(std::move(out));
}

}  // namespace coveragesim
