#include "session/QVReportingWorkerRegistry.h"

#include <memory>
#include <mutex>

#include "session/QVReportingLog.h"

namespace qv {

namespace {

std::mutex gRegistryMutex;
QVReportingWorkerRegistry::ClassList gAllClasses;            // guarded by gRegistryMutex
std::unique_ptr<const QVReportingWorkerRegistry> gRegistry;  // guarded by gRegistryMutex

}  // namespace

QVReportingWorkerRegistry::QVReportingWorkerRegistry(ClassList all) : all_(std::move(all)) {
    for (const QVReportingWorkerClass* cls : all_) {
        if (cls->initWithSession == nullptr) {
            QVLOG_DEBUG(QVReportingSessionCategory(),
                        "Worker does not implement initWithSession! {}", cls->name);
            continue;
        }
        usable_.push_back(cls);
        if (cls->isConsumer) {
            consumers_.push_back(cls);
        }
        if (cls->isProducer) {
            producers_.push_back(cls);
        }
        if (cls->startOnInit) {
            startOnInit_.push_back(cls);
        }
    }
}

void QVReportingWorkerRegistry::setAllWorkerClasses(ClassList classes) {
    std::lock_guard lock(gRegistryMutex);
    gAllClasses = std::move(classes);
}

const QVReportingWorkerRegistry& QVReportingWorkerRegistry::shared() {
    std::lock_guard lock(gRegistryMutex);
    if (!gRegistry) {
        gRegistry.reset(new QVReportingWorkerRegistry(gAllClasses));
    }
    return *gRegistry;
}

void QVReportingWorkerRegistry::TEST_reset(ClassList classes) {
    std::lock_guard lock(gRegistryMutex);
    gAllClasses = std::move(classes);
    gRegistry.reset();
}

}  // namespace qv
