#include "workers/diagnostics/WorkerInstanceState.h"

#include <map>

namespace qv {

std::optional<std::string> WorkerInstanceState::currentIcxSessionIdentifier() const {
    std::lock_guard lock(identifierMutex_);
    return currentIcxSessionIdentifier_;
}

void WorkerInstanceState::setCurrentIcxSessionIdentifier(std::string identifier) {
    std::lock_guard lock(identifierMutex_);
    currentIcxSessionIdentifier_ = std::move(identifier);
}

namespace {

struct Registry {
    std::mutex mutex;
    std::map<std::string, std::shared_ptr<WorkerInstanceState>, std::less<>> states;
};

Registry& registry() {
    // Built once, on first use, and kept until the process ends.
    static Registry* r = new Registry;
    return *r;
}

}  // namespace

std::shared_ptr<WorkerInstanceState> QVReportingICXSharedStates::stateForClass(
    std::string_view className, const std::function<void(WorkerInstanceState&)>& configure) {
    Registry& r = registry();
    std::lock_guard lock(r.mutex);
    if (auto it = r.states.find(className); it != r.states.end()) {
        return it->second;
    }
    auto state = std::make_shared<WorkerInstanceState>();
    if (configure) {
        configure(*state);
    }
    r.states.emplace(std::string(className), state);
    return state;
}

void QVReportingICXSharedStates::TEST_reset() {
    Registry& r = registry();
    std::lock_guard lock(r.mutex);
    r.states.clear();
}

}  // namespace qv
