#include "platform/host/HostDeviceProperties.h"

#include <sys/utsname.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <sstream>

#include "core/AtomicFile.h"
#include "core/Log.h"

namespace qax {
namespace {

constexpr const char* kDeviceFile = "device.plist";
constexpr const char* kSerialNumberKey = "SerialNumber";
constexpr const char* kProductTypeKey = "ProductType";
constexpr const char* kProductVersionKey = "ProductVersion";
constexpr const char* kInternalBuildKey = "InternalBuild";
constexpr const char* kVersionIdField = "VERSION_ID=";
// Only root may read the serial numbers on most machines; the board's is the fallback for
// machines whose vendor left the product's empty.
constexpr std::array kSerialFiles = {"product_serial", "board_serial"};
constexpr const char* kProductNameFile = "product_name";
constexpr std::size_t kMaxDmiBytes = 4096;

// What firmware writes when the vendor filled in nothing, compared without regard to case.
constexpr std::array kPlaceholders = {
    "to be filled by o.e.m.",
    "default string",
    "system serial number",
    "not applicable",
    "none",
    "n/a",
    "0123456789",
};

std::string trimmed(std::string_view s) {
    while (!s.empty() && std::isspace(static_cast<unsigned char>(s.front()))) {
        s.remove_prefix(1);
    }
    while (!s.empty() && std::isspace(static_cast<unsigned char>(s.back()))) {
        s.remove_suffix(1);
    }
    return std::string(s);
}

// Empty, a placeholder, or nothing but zeros (and separators).
bool isPlaceholder(const std::string& value) {
    if (value.empty()) {
        return true;
    }
    std::string lower = value;
    std::transform(lower.begin(), lower.end(), lower.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    if (std::find(kPlaceholders.begin(), kPlaceholders.end(), lower) != kPlaceholders.end()) {
        return true;
    }
    return std::all_of(value.begin(), value.end(), [](unsigned char c) {
        return c == '0' || c == '-' || c == ' ' || c == ':' || c == '.';
    });
}

// The trimmed content of a DMI attribute; none (with `error` set) when it cannot be read.
std::optional<std::string> readAttribute(const std::string& path, std::string* error) {
    auto text = readWholeFile(path, kMaxDmiBytes);
    if (!text) {
        *error = std::strerror(errno);
        return std::nullopt;
    }
    return trimmed(*text);
}

}  // namespace

HostDeviceProperties::HostDeviceProperties(const std::string& platformRoot,
                                           std::string osReleasePath, std::string dmiDirectory)
    : file_((std::filesystem::path(platformRoot) / kDeviceFile).string()),
      osReleasePath_(std::move(osReleasePath)),
      dmiDirectory_(std::move(dmiDirectory)) {}

std::optional<Value> HostDeviceProperties::copyDeviceProperty(std::string_view name) {
    bool present = false;
    auto root = file_.read(&present);
    if (present) {
        // A file that is there but unreadable describes no device rather than this machine.
        if (root) {
            if (const Value* v = root->find(name)) {
                return *v;
            }
        }
        if (name == kSerialNumberKey) {
            return std::nullopt;
        }
    }
    const std::optional<std::string>* fact = nullptr;
    if (name == kSerialNumberKey) {
        fact = &machineSerialNumber();
    } else if (name == kProductTypeKey) {
        fact = &machine().productType;
    } else if (name == kProductVersionKey) {
        fact = &machine().systemVersion;
    }
    if (fact && *fact) {
        return Value(**fact);
    }
    return std::nullopt;
}

bool HostDeviceProperties::isInternalBuild() {
    auto root = file_.read();
    const Value* v = root ? root->find(kInternalBuildKey) : nullptr;
    return v && v->truthy();
}

const HostDeviceProperties::MachineFacts& HostDeviceProperties::machine() {
    std::call_once(machineOnce_, [this] { machine_ = readMachineFacts(); });
    return machine_;
}

const std::optional<std::string>& HostDeviceProperties::machineSerialNumber() {
    std::call_once(serialOnce_, [this] { serialNumber_ = readSerialNumber(); });
    return serialNumber_;
}

HostDeviceProperties::MachineFacts HostDeviceProperties::readMachineFacts() const {
    MachineFacts facts;

    std::string error;
    auto name =
        readAttribute((std::filesystem::path(dmiDirectory_) / kProductNameFile).string(), &error);
    if (name && !isPlaceholder(*name)) {
        facts.productType = *name;
    } else {
        // Machines without DMI data (many boards, most containers) still have a type.
        utsname u{};
        if (uname(&u) == 0) {
            facts.productType = std::string(u.machine);
        }
    }

    if (auto text = readWholeFile(osReleasePath_, 1 << 20)) {
        std::istringstream in(*text);
        std::string line;
        while (std::getline(in, line)) {
            if (line.rfind(kVersionIdField, 0) == 0) {
                std::string v = line.substr(std::strlen(kVersionIdField));
                if (v.size() >= 2 && (v.front() == '"' || v.front() == '\'') &&
                    v.back() == v.front()) {
                    v = v.substr(1, v.size() - 2);
                }
                facts.systemVersion = v;
                break;
            }
        }
    }
    return facts;
}

std::optional<std::string> HostDeviceProperties::readSerialNumber() const {
    std::string why;
    for (const char* file : kSerialFiles) {
        const std::string path = (std::filesystem::path(dmiDirectory_) / file).string();
        std::string error;
        auto value = readAttribute(path, &error);
        if (!value) {
            why += (why.empty() ? "" : "; ") + path + ": " + error;
            continue;
        }
        if (isPlaceholder(*value)) {
            // The placeholder itself is no secret, but a real-looking value might be one.
            why += (why.empty() ? "" : "; ") + path + ": no usable value";
            continue;
        }
        return value;
    }
    qaxLog().info(
        "This machine has no serial number (%@); a device.plist under the platform "
        "root can give one",
        why);
    return std::nullopt;
}

}  // namespace qax
