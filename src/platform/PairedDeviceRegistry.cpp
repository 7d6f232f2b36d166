#include "platform/PairedDeviceRegistry.h"

#include "core/Log.h"

namespace qax {

std::string PairedDevice::describe(bool markPrivate) const {
    auto mark = [markPrivate](const std::optional<std::string>& text) {
        return text ? (markPrivate ? privateText(*text) : *text) : std::string("(null)");
    };
    std::string out = mark(name);
    out += " (" + localizedModel.value_or("(null)") + ") ";
    out += mark(serialNumber);
    out += " paired ";
    out += pairedDate ? pairedDate->description() : std::string("(null)");
    if (!isPaired) {
        out += " unpaired";
    }
    if (isArchived) {
        out += " archived";
    }
    if (isAltAccount) {
        out += " alt account";
    }
    return out;
}

}  // namespace qax
