// The process-wide log handle (subsystem "com.velmora.Kestova", category "core") and the
// agent's printf-like message formats. Formatting happens on the caller's thread; sinks
// are called concurrently and must lock for themselves.
#pragma once

#include <array>
#include <concepts>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <variant>
#include <vector>

#include "core/Date.h"
#include "core/Value.h"

namespace qax {

enum class LogLevel { Default, Debug, Error };

const char* logLevelName(LogLevel level);

// Where formatted messages go. The host writes to stderr; tests capture.
class LogSink {
  public:
    virtual ~LogSink() = default;
    virtual void write(LogLevel level, std::string_view subsystem, std::string_view category,
                       std::string_view message) = 0;
    virtual bool isEnabled(LogLevel level) const = 0;
    // Whether arguments marked private are shown instead of "<private>".
    virtual bool showsPrivate() const = 0;
};

// One argument of a log message. `None` prints as "(null)".
struct LogArg {
    struct None {};
    std::variant<None, std::string, std::int64_t, std::uint64_t, double> v;
};

template <typename T>
concept HasDescription = requires(const T& t) {
    { t.description() } -> std::convertible_to<std::string>;
};

// What a log shows of an object that holds private values (marked with privateText()); its
// plain description() stays for people and tests.
template <typename T>
concept HasLogDescription = requires(const T& t) {
    { t.logDescription() } -> std::convertible_to<std::string>;
};

template <typename T>
LogArg toLogArg(const T& value) {
    using D = std::decay_t<T>;
    if constexpr (std::is_same_v<D, LogArg>) {
        return value;
    } else if constexpr (std::is_array_v<T>) {
        return LogArg{std::string(value)};
    } else if constexpr (std::is_same_v<D, std::nullptr_t>) {
        return LogArg{};
    } else if constexpr (std::is_same_v<D, bool>) {
        return LogArg{static_cast<std::int64_t>(value ? 1 : 0)};
    } else if constexpr (std::is_integral_v<D> && std::is_signed_v<D>) {
        return LogArg{static_cast<std::int64_t>(value)};
    } else if constexpr (std::is_integral_v<D>) {
        return LogArg{static_cast<std::uint64_t>(value)};
    } else if constexpr (std::is_enum_v<D>) {
        return LogArg{static_cast<std::int64_t>(value)};
    } else if constexpr (std::is_floating_point_v<D>) {
        return LogArg{static_cast<double>(value)};
    } else if constexpr (std::is_same_v<D, const char*> || std::is_same_v<D, char*>) {
        return value ? LogArg{std::string(value)} : LogArg{};
    } else if constexpr (std::is_convertible_v<D, std::string_view>) {
        return LogArg{std::string(std::string_view(value))};
    } else if constexpr (HasLogDescription<D>) {
        return LogArg{std::string(value.logDescription())};
    } else if constexpr (HasDescription<D>) {
        return LogArg{std::string(value.description())};
    } else if constexpr (requires {
                             value.has_value();
                             *value;
                         }) {
        return value ? toLogArg(*value) : LogArg{};
    } else if constexpr (requires {
                             value.get();
                             *value;
                         }) {
        return value ? toLogArg(*value) : LogArg{};
    } else {
        static_assert(sizeof(D) == 0, "type cannot be logged");
    }
}

// Marks `text` as private wherever it ends up in a message, even inside an object's
// description that is logged with "%@": the log prints "<private>" in its place unless private
// logging is on. Serial numbers are logged only this way or through "%{private}@".
std::string privateText(std::string_view text);
template <typename T>
requires std::same_as<T, std::optional<std::string>> std::optional<std::string> privateText(
    const T& text) {
    return text ? std::optional<std::string>(privateText(std::string_view(*text))) : std::nullopt;
}
// A formatted message as a sink should show it: marked spans become "<private>", or lose their
// marks when private logging is on.
std::string resolvePrivateText(std::string message, bool showPrivate);

// Objects in the bracketed list form of logs, one per line: "(\n    a,\n    b\n)".
template <typename Range>
std::string logDescriptionOfList(const Range& objects) {
    std::string text = "(\n";
    std::size_t left = std::size(objects);
    for (const auto& object : objects) {
        text += "    ";
        text += object ? object->logDescription() : std::string("(null)");
        text += --left > 0 ? ",\n" : "\n";
    }
    return text + ")";
}

// Expands %@, %{private}@, %{public}@, %{public}s, %s, %d, %ld, %lu, %u, %.02f, %f and %%.
std::string formatLogMessage(std::string_view format, std::span<const LogArg> args,
                             bool showPrivate);
inline std::string formatLogMessage(std::string_view format, std::initializer_list<LogArg> args,
                                    bool showPrivate) {
    return formatLogMessage(format, std::span<const LogArg>(args.begin(), args.size()),
                            showPrivate);
}

class Log {
  public:
    Log(std::string subsystem, std::string category, std::shared_ptr<LogSink> sink);

    template <typename... A>
    void info(std::string_view format, const A&... args) {
        emit(LogLevel::Default, format, args...);
    }
    template <typename... A>
    void debug(std::string_view format, const A&... args) {
        emit(LogLevel::Debug, format, args...);
    }
    template <typename... A>
    void error(std::string_view format, const A&... args) {
        emit(LogLevel::Error, format, args...);
    }

    template <typename... A>
    void emit(LogLevel level, std::string_view format, const A&... args) {
        auto s = sink();
        if (!s || !s->isEnabled(level)) {
            return;
        }
        const std::array<LogArg, sizeof...(A)> list{toLogArg(args)...};
        const bool showPrivate = s->showsPrivate();
        s->write(level, subsystem_, category_,
                 resolvePrivateText(formatLogMessage(format, list, showPrivate), showPrivate));
    }

    std::shared_ptr<LogSink> sink() const;
    // Rebinds the handle (start-up binds the platform's sink; tests bind a capturing one).
    void setSink(std::shared_ptr<LogSink> sink);

  private:
    const std::string subsystem_;
    const std::string category_;
    mutable std::mutex mutex_;
    std::shared_ptr<LogSink> sink_;
};

inline constexpr const char* kLogSubsystem = "com.velmora.Kestova";
inline constexpr const char* kLogCategory = "core";

// The shared log handle, created once on first use (bound to a stderr sink until rebound).
Log& qaxLog();

// Lines this thread writes to a StderrLogSink while a LogBatch lives are held and written
// together, with one system call, when the outermost batch ends; an error line is written at
// once, with what is held. For bounded work that never waits (serving a request), so that its
// lines cost one write, made after its reply. Each line keeps the time it was logged at.
class LogBatch {
  public:
    LogBatch();
    ~LogBatch();
    LogBatch(const LogBatch&) = delete;
    LogBatch& operator=(const LogBatch&) = delete;
};

// One line per message on stderr: time, level, subsystem:category, message. Reads
// QAX_LOG_LEVEL ("debug" shows debug lines) and QAX_LOG_PRIVATE ("1" shows private values).
// When stderr is the journal's stream (JOURNAL_STREAM names it), a line starts with the
// journal priority of its level ("<3>" error, "<6>" default, "<7>" debug) instead of the
// time, which the journal records itself.
class StderrLogSink : public LogSink {
  public:
    StderrLogSink();
    StderrLogSink(bool debug, bool showPrivate, bool journal = false)
        : debug_(debug), private_(showPrivate), journal_(journal) {}
    void write(LogLevel level, std::string_view subsystem, std::string_view category,
               std::string_view message) override;
    bool isEnabled(LogLevel level) const override { return level != LogLevel::Debug || debug_; }
    bool showsPrivate() const override { return private_; }

    // The line written for one message, newline included; `time` is "YYYY-MM-DD hh:mm:ss.mmm".
    static std::string formatLine(LogLevel level, std::string_view subsystem,
                                  std::string_view category, std::string_view message,
                                  std::string_view time, bool journal);
    // The same line appended to `out`.
    static void appendLine(std::string& out, LogLevel level, std::string_view subsystem,
                           std::string_view category, std::string_view message,
                           std::string_view time, bool journal);
    // Whether `fd` is the stream JOURNAL_STREAM ("device:inode") names.
    static bool isJournalStream(const char* journalStream, int fd);
    // Writes `bytes` to stderr with one write() where it can.
    static void writeToStderr(std::string_view bytes);

  private:
    bool debug_ = false;
    bool private_ = false;
    bool journal_ = false;
};

// Keeps every message in memory, for tests to assert on.
class CapturingLogSink : public LogSink {
  public:
    struct Entry {
        LogLevel level;
        std::string message;
    };
    explicit CapturingLogSink(bool showPrivate = true) : private_(showPrivate) {}
    void write(LogLevel level, std::string_view subsystem, std::string_view category,
               std::string_view message) override;
    bool isEnabled(LogLevel) const override { return true; }
    bool showsPrivate() const override { return private_; }

    std::vector<Entry> entries() const;
    std::vector<std::string> messages() const;
    // Number of messages equal to `text`.
    int count(std::string_view text) const;
    bool contains(std::string_view text) const { return count(text) > 0; }
    // Number of messages containing `fragment`.
    int countContaining(std::string_view fragment) const;
    void clear();

  private:
    bool private_;
    mutable std::mutex mutex_;
    std::vector<Entry> entries_;
};

}  // namespace qax
