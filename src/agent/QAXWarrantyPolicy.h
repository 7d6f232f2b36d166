// How a warranty query may use the cache and the network. Values other than these are
// accepted and behave as the policy rules say. A plain value; any thread.
#pragma once

#include <cstdint>

namespace qax {

enum QAXWarrantyPolicy : std::uint64_t {
    QAXWarrantyPolicyDefault = 0,
    QAXWarrantyPolicyCachedOnly = 1,
    QAXWarrantyPolicyForceDownload = 2,
};

}  // namespace qax
