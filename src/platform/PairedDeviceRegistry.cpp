#include "platform/PairedDeviceRegistry.h"

namespace qax {

std::string PairedDevice::description() const {
    std::string out = name.value_or("(null)");
    out += " (" + localizedModel.value_or("(null)") + ") ";
    out += serialNumber.value_or("(null)");
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
