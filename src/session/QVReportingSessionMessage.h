// One message of a reporting session: a payload with its category and type, and the flags the
// session sets while it takes the message in.
//
// Thread safety: a message belongs to its session and is read and written on the reporting
// server queue only; a worker that hands a message to another thread keeps it alive by holding a
// shared_ptr and only reads it there.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "session/QVReportingVocabulary.h"
#include "values/Value.h"

namespace qv {

struct QVReportingWorkerClass;

class QVReportingSessionMessage {
  public:
    // initWithMessage:category:type: — the message owns a new top-level dictionary holding every
    // entry of payload; nested containers are shared with the caller (they are immutable).
    QVReportingSessionMessage(const Dictionary& payload, AudioEventCategory category,
                              AudioEventType type);
    QVReportingSessionMessage(Dictionary&& payload, AudioEventCategory category,
                              AudioEventType type);

    static std::shared_ptr<QVReportingSessionMessage> initWithMessage(const Dictionary& payload,
                                                                      AudioEventCategory category,
                                                                      AudioEventType type) {
        return std::make_shared<QVReportingSessionMessage>(payload, category, type);
    }

    Dictionary& message() { return message_; }
    const Dictionary& message() const { return message_; }
    AudioEventCategory category() const { return category_; }
    void setCategory(AudioEventCategory category) { category_ = category; }
    AudioEventType type() const { return type_; }
    void setType(AudioEventType type) { type_ = type; }
    bool isRedundant() const { return isRedundant_; }
    void setIsRedundant(bool redundant) { isRedundant_ = redundant; }
    bool isSessionStarted() const { return isSessionStarted_; }
    void setIsSessionStarted(bool started) { isSessionStarted_ = started; }
    // When not empty, only consuming workers of these classes receive the message.
    const std::vector<const QVReportingWorkerClass*>& destinationWorkers() const {
        return destinationWorkers_;
    }
    void setDestinationWorkers(std::vector<const QVReportingWorkerClass*> classes) {
        destinationWorkers_ = std::move(classes);
    }

    // "category=<category> type=<type> <payload>"
    std::string description() const;

    // copyWithZone: — a copy of the payload and the flags, without destination workers.
    std::shared_ptr<QVReportingSessionMessage> copy() const;

    // Stable sort by "qvreporting_timestamp", oldest first; equal times keep their order.
    static void sortMessages(std::vector<std::shared_ptr<QVReportingSessionMessage>>& messages);

  private:
    Dictionary message_;
    AudioEventCategory category_;
    AudioEventType type_;
    bool isRedundant_ = false;
    bool isSessionStarted_ = false;
    std::vector<const QVReportingWorkerClass*> destinationWorkers_;
};

}  // namespace qv
