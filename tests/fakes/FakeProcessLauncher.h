// Process execution in memory: each command prints the lines the test scripted for it and ends
// as scripted. Launches are recorded. A command without a script cannot be found.
#pragma once

#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "platform/ProcessLauncher.h"

namespace qv::test {

class FakeProcessLauncher : public ProcessLauncher {
  public:
    struct Script {
        std::vector<std::string> lines;
        ProcessPipe::Outcome outcome;
        int launchError = 0;  // nonzero: the command cannot be started at all
    };

    void script(const std::string& command, Script s) {
        std::lock_guard lock(mutex_);
        scripts_[command] = std::move(s);
    }
    std::vector<std::string> launches() const {
        std::lock_guard lock(mutex_);
        return launches_;
    }
    std::vector<ProcessPipeLimits> limits() const {
        std::lock_guard lock(mutex_);
        return limits_;
    }

    Launched launch(const std::string& command, const ProcessPipeLimits& limits) override {
        Script s;
        {
            std::lock_guard lock(mutex_);
            launches_.push_back(command);
            limits_.push_back(limits);
            const auto it = scripts_.find(command);
            if (it == scripts_.end()) {
                s.outcome.ending = ProcessPipe::Ending::NotExecutable;
                s.outcome.exitStatus = 127;
            } else {
                s = it->second;
            }
        }
        if (s.launchError != 0) {
            return {nullptr, s.launchError};
        }
        return {std::make_unique<Pipe>(std::move(s)), 0};
    }

  private:
    class Pipe : public ProcessPipe {
      public:
        explicit Pipe(Script s) : script_(std::move(s)) {}
        std::optional<std::string> readLine() override {
            if (next_ >= script_.lines.size()) {
                return std::nullopt;
            }
            return script_.lines[next_++];
        }
        Outcome close() override { return script_.outcome; }

      private:
        Script script_;
        std::size_t next_ = 0;
    };

    mutable std::mutex mutex_;
    std::map<std::string, Script> scripts_;
    std::vector<std::string> launches_;
    std::vector<ProcessPipeLimits> limits_;
};

}  // namespace qv::test
