// The process-wide registry of worker classes: the fixed, ordered list of every class, and the
// four lists derived from it once per process (usable, consumers, producers, start-on-init), each
// in the same order.
//
// The list itself is handed in when the process starts (the daemon's table lives with the
// workers, which this folder never includes); the derived lists are built on the creation of the
// first session.
//
// Thread safety: safe to call from any thread; the derived lists are built exactly once.
#pragma once

#include <vector>

#include "session/QVReportingWorkerClass.h"

namespace qv {

class QVReportingWorkerRegistry {
  public:
    using ClassList = std::vector<const QVReportingWorkerClass*>;

    // Sets the list of every worker class, in its fixed order. Call once, before any session.
    static void setAllWorkerClasses(ClassList classes);
    // The registry, built on first use from the list set above.
    static const QVReportingWorkerRegistry& shared();

    const ClassList& allWorkerClasses() const { return all_; }
    const ClassList& usableWorkerClasses() const { return usable_; }
    const ClassList& consumerWorkerClasses() const { return consumers_; }
    const ClassList& producerWorkerClasses() const { return producers_; }
    const ClassList& startOnInitWorkerClasses() const { return startOnInit_; }

    // For tests only: replaces the list and forgets the built registry. No session may be
    // creating workers meanwhile.
    static void TEST_reset(ClassList classes);

  private:
    explicit QVReportingWorkerRegistry(ClassList all);

    ClassList all_;
    ClassList usable_;
    ClassList consumers_;
    ClassList producers_;
    ClassList startOnInit_;
};

}  // namespace qv
