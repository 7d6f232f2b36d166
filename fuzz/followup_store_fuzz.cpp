// The follow-up store file as it may be found on disk (shared with qaxctl, hand-edited):
// read through the host follow-up service, then each of its changes once. Posting leaves
// exactly one item with the posted identifier, clearing leaves none, and clearing a
// notification keeps the item without its notification.
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <string>

#include "FuzzPlatform.h"
#include "platform/host/HostFollowUpCenter.h"

namespace {

constexpr const char* kClient = "com.velmora.Kestova";

int countWithIdentifier(qax::HostFollowUpCenter& center, const std::string& id, bool* notified) {
    int n = 0;
    for (const auto& stored : center.storedItems(kClient)) {
        if (stored.item.uniqueIdentifier == id) {
            ++n;
            *notified = stored.item.notification.has_value();
        }
    }
    return n;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    qaxfuzz::quietLog();
    static const std::string root = qaxfuzz::scratchDirectory() + "/followup-root";
    static auto center =
        std::make_shared<qax::HostFollowUpCenter>(root, std::make_shared<qax::ManualClock>());
    static const std::string path =
        qax::HostFollowUpCenter::storeDirectory(root) + "/" + kClient + ".plist";
    qaxfuzz::putFile(path, data, size);
    // Delivered notifications append to a log of their own; keep it from growing.
    ::unlink(qax::HostFollowUpCenter::notificationsPath(root).c_str());

    auto stored = center->storedItems(kClient);
    // Post back the first item read (or a fresh one), with a notification.
    qax::FollowUpItem item;
    if (!stored.empty() && stored.front().item.uniqueIdentifier) {
        item = stored.front().item;
    } else {
        item.uniqueIdentifier = "fuzz.item";
        item.title = "Title";
    }
    item.notification = qax::FollowUpNotification{};
    item.notification->title = "Notification";
    const std::string id = *item.uniqueIdentifier;
    std::string error;
    bool notified = false;
    if (center->postFollowUpItem(kClient, item, &error)) {
        if (countWithIdentifier(*center, id, &notified) != 1 || !notified) {
            __builtin_trap();
        }
        if (!center->clearNotificationForItem(kClient, item, &error) ||
            countWithIdentifier(*center, id, &notified) != 1 || notified) {
            __builtin_trap();
        }
    }
    if (center->clearPendingFollowUpItemsWithUniqueIdentifiers(kClient, {id}, &error) &&
        countWithIdentifier(*center, id, &notified) != 0) {
        __builtin_trap();
    }
    return 0;
}
