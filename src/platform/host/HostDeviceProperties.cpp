#include "platform/host/HostDeviceProperties.h"

#include <sys/utsname.h>

#include <filesystem>
#include <sstream>

#include "core/AtomicFile.h"

namespace qax {

HostDeviceProperties::HostDeviceProperties(const std::string& platformRoot,
                                           std::string osReleasePath)
    : file_((std::filesystem::path(platformRoot) / "device.plist").string()),
      osReleasePath_(std::move(osReleasePath)) {}

std::optional<Value> HostDeviceProperties::copyDeviceProperty(std::string_view name) {
    if (auto root = file_.read()) {
        if (const Value* v = root->find(name)) {
            return *v;
        }
    }
    return hostFact(name);
}

bool HostDeviceProperties::isInternalBuild() {
    auto root = file_.read();
    const Value* v = root ? root->find("InternalBuild") : nullptr;
    return v && v->truthy();
}

std::optional<Value> HostDeviceProperties::hostFact(std::string_view name) const {
    if (name == "ProductType") {
        utsname u{};
        if (uname(&u) == 0) {
            return Value(std::string(u.machine));
        }
        return std::nullopt;
    }
    if (name == "ProductVersion") {
        auto text = readWholeFile(osReleasePath_, 1 << 20);
        if (!text) {
            return std::nullopt;
        }
        std::istringstream in(*text);
        std::string line;
        while (std::getline(in, line)) {
            if (line.rfind("VERSION_ID=", 0) == 0) {
                std::string v = line.substr(11);
                if (v.size() >= 2 && (v.front() == '"' || v.front() == '\'') &&
                    v.back() == v.front()) {
                    v = v.substr(1, v.size() - 2);
                }
                return Value(v);
            }
        }
    }
    return std::nullopt;
}

}  // namespace qax
