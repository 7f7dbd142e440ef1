// What a payload read from a client costs against its budget, counted the same way by both of the
// daemon's payload readers (sd-bus's, and the one over a call's bytes): each value counts, a
// variant's wrapping does not, and the bytes approximate the payload's size on the wire. The
// first limit passed is kept as the refusal, naming the top-level key being read.
//
// Thread safety: one meter per read, on one thread.
#pragma once

#include <cstddef>
#include <optional>
#include <string>

#include "service/QVReportingError.h"
#include "session/QVReportingStats.h"

namespace qv {

// Bounds on one payload or configuration read from a client.
struct QVReportingInputBudget {
    std::size_t maxBytes;
    std::size_t maxValues;
    std::size_t maxDepth;
};

class QVReportingPayloadMeter {
  public:
    explicit QVReportingPayloadMeter(const QVReportingInputBudget& budget) : budget_(budget) {}

    // Each returns false once the input is refused (error and limit then say why).
    bool charge(std::size_t bytes);
    bool countValue();
    // Checks a container at depth against the budget's nesting.
    bool enterDepth(std::size_t depth) { return depth <= budget_.maxDepth || refuseDepth(); }
    bool refuseDepth();

    std::size_t bytes() const { return bytes_; }

    std::optional<QVReportingError> error;
    std::optional<QVReportingStats::Limit> limit;
    std::string key;  // the top-level key being read, for error messages

  private:
    bool refuse(QVReportingStats::Limit which, std::string why);

    const QVReportingInputBudget& budget_;
    std::size_t bytes_ = 0;
    std::size_t values_ = 0;
};

}  // namespace qv
