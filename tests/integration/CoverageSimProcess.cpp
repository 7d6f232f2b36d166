#include "CoverageSimProcess.h"

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include "core/AtomicFile.h"
#include "core/JsonCodec.h"

namespace qax::test {

CoverageSimProcess::CoverageSimProcess(const std::string& state, const std::string& platformRoot,
                                       const std::vector<std::string>& extraArgs,
                                       const std::vector<std::string>& environment)
    : state_(state) {
    std::vector<std::string> args = {QAX_SIM_BINARY,
                                     "--state",
                                     state,
                                     "--platform-root",
                                     platformRoot,
                                     "--attestation-root",
                                     platformRoot + "/state/attestation/ca.pem"};
    args.insert(args.end(), extraArgs.begin(), extraArgs.end());
    // Everything the child needs is built before the fork: only exec-safe calls after it.
    std::vector<std::string> env(environment);
    for (char** e = environ; *e; ++e) {
        env.push_back(*e);
    }
    std::vector<char*> argv, envp;
    for (auto& a : args) {
        argv.push_back(a.data());
    }
    for (auto& e : env) {
        envp.push_back(e.data());
    }
    argv.push_back(nullptr);
    envp.push_back(nullptr);
    int out[2];
    if (pipe(out) != 0) {
        return;
    }
    pid_ = fork();
    if (pid_ == 0) {
        dup2(out[1], STDOUT_FILENO);
        close(out[0]);
        execve(QAX_SIM_BINARY, argv.data(), envp.data());
        _exit(127);
    }
    close(out[1]);
    std::string line;
    char c;
    while (read(out[0], &c, 1) == 1 && c != '\n') {
        line += c;
    }
    close(out[0]);
    auto colon = line.rfind(':');
    if (line.find("listening") != std::string::npos && colon != std::string::npos) {
        base_ = "https://127.0.0.1:" + line.substr(colon + 1);
    }
}

CoverageSimProcess::~CoverageSimProcess() {
    if (pid_ > 0) {
        kill(pid_, SIGTERM);
        waitpid(pid_, nullptr, 0);
    }
}

std::vector<Value> CoverageSimProcess::requestLog() const {
    std::vector<Value> out;
    auto text = readWholeFile(state_ + "/requests.jsonl").value_or("");
    std::size_t start = 0, end;
    while ((end = text.find('\n', start)) != std::string::npos) {
        if (auto v = parseJson(text.substr(start, end - start))) {
            out.push_back(*v);
        }
        start = end + 1;
    }
    return out;
}

}  // namespace qax::test
