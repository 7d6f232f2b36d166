// The real coverage-sim for integration tests: started on a free port with the given state
// directory, platform root and extra options, its base URL read from the line it prints,
// stopped with SIGTERM when the object goes. Also reads its request log.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "SpawnedProcess.h"
#include "core/Value.h"
#include "platform/HttpClient.h"

namespace qax::test {

class CoverageSimProcess {
  public:
    // `environment` entries ("NAME=value") are added to this process's own.
    CoverageSimProcess(const std::string& state, const std::string& platformRoot,
                       const std::vector<std::string>& extraArgs = {},
                       const std::vector<std::string>& environment = {});
    ~CoverageSimProcess() { process_->stop(); }

    // "https://127.0.0.1:PORT"; empty when the simulator did not start.
    const std::string& base() const { return base_; }
    // The CA that issued the simulator's certificate.
    std::string caFile() const { return state_ + "/ca.pem"; }
    // Sends `request` over a session of its own that trusts the simulator; the answer.
    HttpResult send(const HttpRequest& request) const;
    // `method` on `path` (after base()), with a body when one is given.
    HttpResult call(const std::string& method, const std::string& path,
                    std::optional<std::string> body = std::nullopt) const;
    // The lines of requests.jsonl, parsed.
    std::vector<Value> requestLog() const;

  private:
    std::string state_;
    std::unique_ptr<SpawnedProcess> process_;
    std::string base_;
};

}  // namespace qax::test
