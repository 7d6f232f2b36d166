// A device provider of the test's making: a phone and two paired watches unless the test
// changes them (before use).
#pragma once

#include "devices/QAXAgentDeviceProvider.h"

namespace qax::test {

class FixedDeviceProvider : public QAXAgentDeviceProvider {
  public:
    std::shared_ptr<QAXDevice> defaultDevice() override { return phone; }
    QAXDeviceMap pairedDevices() override { return watches; }
    QAXDeviceMap allDevices() override {
        QAXDeviceMap all = watches;
        if (phone) {
            all[*phone->serialNumber()] = phone;
        }
        return all;
    }
    std::shared_ptr<QAXDevice> phone =
        QAXDevice::deviceWithName("Default Device", "PHONE1", Date(10), QAXDeviceTypeDefault);
    QAXDeviceMap watches = {
        {"W1", QAXDevice::deviceWithName("One", "W1", Date(20), QAXDeviceTypeWatch)},
        {"W2", QAXDevice::deviceWithName("Two", "W2", std::nullopt, QAXDeviceTypeWatch)},
    };
};

}  // namespace qax::test
