// A trace-model reader in memory: its model knows a set of probes by name, each with its
// children and events, and answers a probe dictionary with the probe of the dictionary's "Name"
// (an unknown name is a problem, as a bad dictionary is to the real reader). One tick of its time
// base lasts secondsPerTick. Every trace file and every list of dictionaries it is given are
// recorded.
#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/ThreadlineModelReader.h"

namespace qv::test {

class FakeThreadlineModel : public ThreadlineModel {
  public:
    std::vector<ThreadlineProbe> probesFromDictionaries(
        const std::vector<Dictionary>& dictionaries,
        std::vector<std::string>* problems) const override {
        std::lock_guard lock(mutex_);
        asked.push_back(dictionaries);
        std::vector<ThreadlineProbe> result;
        for (const Dictionary& d : dictionaries) {
            const Value* name = d.find(threadline::kProbeName);
            const auto known =
                name && name->isString() ? probes.find(*name->asString()) : probes.end();
            if (known == probes.end()) {
                if (problems) {
                    problems->push_back("unknown probe " + QVReportingValueText(name));
                }
                continue;
            }
            result.push_back(known->second);
        }
        return result;
    }
    double secondsFromTimebase(std::uint64_t duration) const override {
        return static_cast<double>(duration) * secondsPerTick;
    }
    std::string summary() const override { return "fake model"; }

    std::map<std::string, ThreadlineProbe> probes;
    double secondsPerTick = 1e-6;
    mutable std::vector<std::vector<Dictionary>> asked;  // guarded by mutex_

  private:
    mutable std::mutex mutex_;
};

class FakeThreadlineModelReader : public ThreadlineModelReader {
  public:
    Built modelFromTraceFile(const std::filesystem::path& location) override {
        std::lock_guard lock(mutex_);
        locations.push_back(location);
        if (error) {
            return {nullptr, *error};
        }
        return {model, {}};
    }

    std::shared_ptr<FakeThreadlineModel> model = std::make_shared<FakeThreadlineModel>();
    std::optional<std::string> error;
    std::vector<std::filesystem::path> locations;

  private:
    std::mutex mutex_;
};

}  // namespace qv::test
