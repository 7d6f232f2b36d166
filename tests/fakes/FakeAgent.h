// An agent of the test's making for the activities and monitors: all-device-infos requests are
// recorded and answered with the infos the test set, at once or held until released (from any
// thread). The other requests answer at once with empty results. Thread-safe.
#pragma once

#include <mutex>
#include <vector>

#include "agent/QAXAgentProtocol.h"

namespace qax::test {

class FakeAgent : public QAXAgentProtocol {
  public:
    using InfoList = std::vector<std::shared_ptr<QAXDeviceInfo>>;
    struct Request {
        QAXWarrantyPolicy policy;
        bool updateFollowUps;
    };

    void getAllDeviceInfosUsingPolicy(QAXWarrantyPolicy policy, bool updateFollowUps,
                                      QAXDeviceInfoListReply reply) override {
        std::unique_lock lock(mutex_);
        requests_.push_back({policy, updateFollowUps});
        if (hold_) {
            held_.push_back(std::move(reply));
            return;
        }
        InfoList infos = infos_;
        lock.unlock();
        reply(std::move(infos));
    }

    void setInfos(InfoList infos) {
        std::lock_guard lock(mutex_);
        infos_ = std::move(infos);
    }
    void hold(bool hold) {
        std::lock_guard lock(mutex_);
        hold_ = hold;
    }
    // Answers every held request; returns how many there were.
    std::size_t release() {
        std::vector<QAXDeviceInfoListReply> due;
        InfoList infos;
        {
            std::lock_guard lock(mutex_);
            due.swap(held_);
            infos = infos_;
        }
        for (auto& reply : due) {
            reply(infos);
        }
        return due.size();
    }
    std::vector<Request> requests() {
        std::lock_guard lock(mutex_);
        return requests_;
    }

    void scheduleOutreach(QAXBoolReply reply) override { reply(true); }
    void scheduleOutreachAfter(double, QAXBoolReply reply) override { reply(true); }
    void velmoraAccountAdded(QAXBoolReply reply) override { reply(true); }
    void checkIsAvailableInStore(
        const std::string&, std::function<void(std::optional<Value::Dictionary>)> reply) override {
        reply(std::nullopt);
    }
    void appSupportAvailability(const std::string&,
                                std::function<void(Value::Dictionary)> reply) override {
        reply({});
    }
    void readWebURLOverride(std::function<void(std::optional<Value>)> reply) override {
        reply(std::nullopt);
    }
    void defaultDevice(QAXDeviceReply reply) override { reply(nullptr); }
    void pairedDevices(QAXDeviceListReply reply) override { reply({}); }
    void getDefaultDeviceInfoUsingPolicy(QAXWarrantyPolicy, QAXDeviceInfoReply reply) override {
        reply(nullptr);
    }
    void getDeviceInfoForSerialNumber(const std::string&, QAXWarrantyPolicy,
                                      QAXDeviceInfoReply reply) override {
        reply(nullptr);
    }
    void dismissFollowUpForSerialNumber(const std::string&, QAXBoolReply completion) override {
        completion(true);
    }
    void dismissNotificationForSerialNumber(const std::string&, QAXBoolReply completion) override {
        completion(true);
    }

  private:
    std::mutex mutex_;
    InfoList infos_;
    bool hold_ = false;
    std::vector<QAXDeviceInfoListReply> held_;
    std::vector<Request> requests_;
};

}  // namespace qax::test
