#include "core/Log.h"

#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <charconv>
#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>

namespace qax {

const char* logLevelName(LogLevel level) {
    switch (level) {
        case LogLevel::Default:
            return "default";
        case LogLevel::Debug:
            return "debug";
        case LogLevel::Error:
            return "error";
    }
    return "default";
}

namespace {

template <typename I>
void appendInteger(std::string& out, I value) {
    char buf[24];
    auto res = std::to_chars(buf, buf + sizeof buf, value);
    out.append(buf, res.ptr);
}

// The text of one argument, appended in place: a message is built on every request.
void appendArgText(std::string& out, const LogArg& arg) {
    std::visit(
        [&out](const auto& v) {
            using T = std::decay_t<decltype(v)>;
            if constexpr (std::is_same_v<T, LogArg::None>) {
                out += "(null)";
            } else if constexpr (std::is_same_v<T, std::string>) {
                out += v;
            } else if constexpr (std::is_same_v<T, double>) {
                char buf[64];
                const int n = std::snprintf(buf, sizeof buf, "%g", v);
                out.append(buf, static_cast<std::size_t>(std::clamp(n, 0, 63)));
            } else {
                appendInteger(out, v);
            }
        },
        arg.v);
}

void appendArgInteger(std::string& out, const LogArg& arg, bool isUnsigned) {
    if (auto* i = std::get_if<std::int64_t>(&arg.v)) {
        isUnsigned ? appendInteger(out, static_cast<std::uint64_t>(*i)) : appendInteger(out, *i);
    } else if (auto* u = std::get_if<std::uint64_t>(&arg.v)) {
        isUnsigned ? appendInteger(out, *u) : appendInteger(out, static_cast<std::int64_t>(*u));
    } else if (auto* d = std::get_if<double>(&arg.v)) {
        appendInteger(out, static_cast<std::int64_t>(*d));
    } else {
        appendArgText(out, arg);
    }
}

void appendArgDouble(std::string& out, const LogArg& arg, int precision) {
    double d = 0;
    if (auto* p = std::get_if<double>(&arg.v)) {
        d = *p;
    } else if (auto* i = std::get_if<std::int64_t>(&arg.v)) {
        d = static_cast<double>(*i);
    } else if (auto* u = std::get_if<std::uint64_t>(&arg.v)) {
        d = static_cast<double>(*u);
    } else {
        appendArgText(out, arg);
        return;
    }
    char buf[512];
    const int n = std::snprintf(buf, sizeof buf, "%.*f", precision, d);
    out.append(buf, static_cast<std::size_t>(std::clamp(n, 0, 511)));
}

}  // namespace

namespace {

// Bytes that never occur in the texts the agent logs (record and unit separators).
constexpr char kPrivateBegin = '\x1e';
constexpr char kPrivateEnd = '\x1f';
constexpr std::string_view kRedacted = "<private>";

}  // namespace

std::string privateText(std::string_view text) {
    std::string out;
    out.reserve(text.size() + 2);
    out += kPrivateBegin;
    out += text;
    out += kPrivateEnd;
    return out;
}

std::string resolvePrivateText(std::string message, bool showPrivate) {
    std::size_t begin = message.find(kPrivateBegin);
    if (begin == std::string::npos) {
        return message;
    }
    // Copied in runs between marks (find_first_of would call memchr once per character).
    std::string out(message, 0, begin);
    int depth = 0;
    std::size_t at = begin;
    while (at < message.size()) {
        std::size_t mark = at;
        while (mark < message.size() && message[mark] != kPrivateBegin &&
               message[mark] != kPrivateEnd) {
            ++mark;
        }
        if (depth == 0 || showPrivate) {
            out.append(message, at, mark - at);
        }
        if (mark == message.size()) {
            break;
        }
        if (message[mark] == kPrivateBegin) {
            // A nested mark (a private description inside a private one) is one span.
            if (depth++ == 0 && !showPrivate) {
                out += kRedacted;
            }
        } else {
            depth = depth > 0 ? depth - 1 : 0;
        }
        at = mark + 1;
    }
    return out;
}

std::string formatLogMessage(std::string_view format, std::span<const LogArg> args,
                             bool showPrivate) {
    std::string out;
    out.reserve(format.size() + 32);
    std::size_t next = 0;
    auto take = [&]() -> const LogArg* { return next < args.size() ? &args[next++] : nullptr; };
    static const LogArg kMissing{};
    for (std::size_t i = 0; i < format.size(); ++i) {
        char c = format[i];
        if (c != '%') {
            // The literal text up to the next conversion, at once.
            const std::size_t percent = format.find('%', i);
            const std::size_t end = percent == std::string_view::npos ? format.size() : percent;
            out.append(format.substr(i, end - i));
            i = end - 1;
            continue;
        }
        if (i + 1 == format.size()) {
            out += c;
            continue;
        }
        std::size_t j = i + 1;
        if (format[j] == '%') {
            out += '%';
            i = j;
            continue;
        }
        bool isPrivate = false;
        if (format[j] == '{') {
            auto close = format.find('}', j);
            if (close == std::string_view::npos) {
                out += c;
                continue;
            }
            isPrivate = format.substr(j + 1, close - j - 1) == "private";
            j = close + 1;
        }
        // Precision (".02"), then length modifiers, then the conversion.
        int precision = 6;
        if (j < format.size() && format[j] == '.') {
            std::size_t k = j + 1;
            int p = 0;
            while (k < format.size() && std::isdigit(static_cast<unsigned char>(format[k]))) {
                p = p * 10 + (format[k] - '0');
                ++k;
            }
            precision = p;
            j = k;
        }
        while (j < format.size() &&
               (format[j] == 'l' || format[j] == 'h' || format[j] == 'z' || format[j] == 'q')) {
            ++j;
        }
        if (j >= format.size()) {
            out.append(format.substr(i));
            break;
        }
        const LogArg* arg = take();
        if (!arg) {
            arg = &kMissing;
        }
        if (isPrivate && !showPrivate) {
            out += kRedacted;
            i = j;
            continue;
        }
        switch (format[j]) {
            case 'd':
            case 'i':
                appendArgInteger(out, *arg, false);
                break;
            case 'u':
                appendArgInteger(out, *arg, true);
                break;
            case 'f':
            case 'g':
                appendArgDouble(out, *arg, precision);
                break;
            default:  // '@', 's' and the rest
                appendArgText(out, *arg);
                break;
        }
        i = j;
    }
    return out;
}

Log::Log(std::string subsystem, std::string category, std::shared_ptr<LogSink> sink)
    : subsystem_(std::move(subsystem)), category_(std::move(category)), sink_(std::move(sink)) {}

std::shared_ptr<LogSink> Log::sink() const {
    std::lock_guard lock(mutex_);
    return sink_;
}

void Log::setSink(std::shared_ptr<LogSink> sink) {
    std::lock_guard lock(mutex_);
    sink_ = std::move(sink);
}

Log& qaxLog() {
    // Function-local static: created once, safely under concurrent first use.
    static Log log(kLogSubsystem, kLogCategory, std::make_shared<StderrLogSink>());
    return log;
}

StderrLogSink::StderrLogSink() {
    const char* level = std::getenv("QAX_LOG_LEVEL");
    debug_ = level && std::string_view(level) == "debug";
    const char* priv = std::getenv("QAX_LOG_PRIVATE");
    private_ = priv && std::string_view(priv) == "1";
    journal_ = isJournalStream(std::getenv("JOURNAL_STREAM"), STDERR_FILENO);
}

bool StderrLogSink::isJournalStream(const char* journalStream, int fd) {
    if (!journalStream) {
        return false;
    }
    unsigned long long device = 0, inode = 0;
    char rest = 0;
    if (std::sscanf(journalStream, "%llu:%llu%c", &device, &inode, &rest) != 2) {
        return false;
    }
    // A child whose stderr was redirected still inherits the variable: only the named stream
    // itself is the journal.
    struct stat st {};
    return ::fstat(fd, &st) == 0 && static_cast<unsigned long long>(st.st_dev) == device &&
           static_cast<unsigned long long>(st.st_ino) == inode;
}

std::string StderrLogSink::formatLine(LogLevel level, std::string_view subsystem,
                                      std::string_view category, std::string_view message,
                                      std::string_view time, bool journal) {
    std::string line;
    appendLine(line, level, subsystem, category, message, time, journal);
    return line;
}

void StderrLogSink::appendLine(std::string& line, LogLevel level, std::string_view subsystem,
                               std::string_view category, std::string_view message,
                               std::string_view time, bool journal) {
    if (line.empty()) {
        line.reserve(message.size() + 80);
    }
    if (journal) {
        switch (level) {
            case LogLevel::Error:
                line.append("<3>");
                break;
            case LogLevel::Default:
                line.append("<6>");
                break;
            case LogLevel::Debug:
                line.append("<7>");
                break;
        }
    } else {
        line.append(time).append(" ");
    }
    line.append(logLevelName(level)).append(" ");
    line.append(subsystem).append(":").append(category).append(" ").append(message);
    line += '\n';
}

namespace {

// Beyond this much held text a batch is written out early.
constexpr std::size_t kMaxHeldBytes = 64 * 1024;

struct HeldLines {
    int depth = 0;
    std::string text;
};

HeldLines& heldLines() {
    thread_local HeldLines held;
    return held;
}

void writeHeldLines(HeldLines& held) {
    if (held.text.empty()) {
        return;
    }
    StderrLogSink::writeToStderr(held.text);
    held.text.clear();
    if (held.text.capacity() > kMaxHeldBytes) {
        std::string().swap(held.text);
    }
}

constexpr std::size_t kTimestampBytes = 32;

// "YYYY-MM-DD hh:mm:ss.mmm" in local time, into `out`. The part up to the seconds is made once
// a second per thread: formatting the time is most of what a short line costs.
std::string_view formatTimestamp(char (&out)[kTimestampBytes]) {
    timeval tv{};
    gettimeofday(&tv, nullptr);
    struct Cached {
        time_t second = -1;
        char text[kTimestampBytes] = "";
        std::size_t length = 0;
    };
    thread_local Cached cached;
    if (cached.second != tv.tv_sec) {
        std::tm tm{};
        localtime_r(&tv.tv_sec, &tm);
        const int n = std::snprintf(cached.text, sizeof cached.text,
                                    "%04d-%02d-%02d %02d:%02d:%02d", tm.tm_year + 1900,
                                    tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec);
        cached.length = n > 0 ? std::min(static_cast<std::size_t>(n), sizeof cached.text - 1) : 0;
        cached.second = tv.tv_sec;
    }
    const auto ms = static_cast<int>(tv.tv_usec / 1000);
    std::size_t n = std::min(cached.length, kTimestampBytes - 5);
    std::memcpy(out, cached.text, n);
    out[n++] = '.';
    out[n++] = static_cast<char>('0' + ms / 100);
    out[n++] = static_cast<char>('0' + ms / 10 % 10);
    out[n++] = static_cast<char>('0' + ms % 10);
    return std::string_view(out, n);
}

}  // namespace

void StderrLogSink::writeToStderr(std::string_view bytes) {
    // No lock: one write() puts a whole buffer of lines at the end of a file or into the
    // journal's socket at once, and two threads' buffers do not mix. Only a short write (a full
    // disk) could let another thread's lines in between the pieces.
    while (!bytes.empty()) {
        const ssize_t n = ::write(STDERR_FILENO, bytes.data(), bytes.size());
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return;  // nowhere to log to
        }
        bytes.remove_prefix(static_cast<std::size_t>(n));
    }
}

void StderrLogSink::write(LogLevel level, std::string_view subsystem, std::string_view category,
                          std::string_view message) {
    char buffer[kTimestampBytes];
    const std::string_view stamp = journal_ ? std::string_view() : formatTimestamp(buffer);
    HeldLines& held = heldLines();
    if (held.depth == 0) {
        writeToStderr(formatLine(level, subsystem, category, message, stamp, journal_));
        return;
    }
    appendLine(held.text, level, subsystem, category, message, stamp, journal_);
    // An error goes out at once, with what led to it: the process may be about to end.
    if (level == LogLevel::Error || held.text.size() > kMaxHeldBytes) {
        writeHeldLines(held);
    }
}

LogBatch::LogBatch() {
    ++heldLines().depth;
}

LogBatch::~LogBatch() {
    HeldLines& held = heldLines();
    if (--held.depth == 0) {
        writeHeldLines(held);
    }
}

void CapturingLogSink::write(LogLevel level, std::string_view, std::string_view,
                             std::string_view message) {
    std::lock_guard lock(mutex_);
    entries_.push_back({level, std::string(message)});
}

std::vector<CapturingLogSink::Entry> CapturingLogSink::entries() const {
    std::lock_guard lock(mutex_);
    return entries_;
}

std::vector<std::string> CapturingLogSink::messages() const {
    std::lock_guard lock(mutex_);
    std::vector<std::string> out;
    out.reserve(entries_.size());
    for (const auto& e : entries_) {
        out.push_back(e.message);
    }
    return out;
}

int CapturingLogSink::count(std::string_view text) const {
    std::lock_guard lock(mutex_);
    int n = 0;
    for (const auto& e : entries_) {
        n += e.message == text;
    }
    return n;
}

int CapturingLogSink::countContaining(std::string_view fragment) const {
    std::lock_guard lock(mutex_);
    int n = 0;
    for (const auto& e : entries_) {
        n += e.message.find(fragment) != std::string::npos;
    }
    return n;
}

void CapturingLogSink::clear() {
    std::lock_guard lock(mutex_);
    entries_.clear();
}

}  // namespace qax
