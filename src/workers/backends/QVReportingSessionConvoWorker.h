// Mirrors a reporting session into a session of the conversation-quality reporting service
// (Convo). At start it opens a Convo session for the reporter and waits, up to 9 seconds, for the
// service to say which backends will receive it; while that session is live every message is
// forwarded to it; at stop it sends one summary event that folds the session's messages into
// comma-joined lists, flushes and closes the Convo session. Sessions of service type 11 ("test")
// get no worker.
//
// The Convo queue. Every Convo call of one worker runs on the worker's own serial queue,
// "com.korvane.qvsound.session.convoreporting", in submission order. It is a PooledSerialQueue:
// its tasks run on the platform's shared TaskExecutor (a pool of two threads), not on a thread
// of its own, since the daemon may hold up to 4096 sessions for each of 256 clients. The wait
// for backends suspends the queue instead of blocking a thread: the start task asks for the
// configuration and returns; the queue then holds every later task until the service's
// completion signals the semaphore or 9 s have passed since the wait began (a timer of the
// executor), and runs the rest of the start first. So messages sent during the wait are held and
// sent in order afterwards, exactly as if the queue's thread had blocked, while no thread, no
// other session and never the reporting server queue waits with it. Forwarded messages are
// gathered for up to kForwardingGatherDelay (or a turn's worth) before the pool is woken for
// them; start and stop tasks run at once, after whatever was gathered before them.
//
// Intake. handleMessage() must cost the server queue little: a message for the Convo queue is a
// copy of its top level appended to the worker's open outbox (FrozenPayloads: texts in one
// buffer, keys and nested containers shared), and one Convo-queue task takes a whole outbox, so a
// stream of messages allocates and frees in batches rather than per message. A start or stop
// closes the open outbox before it queues its task, so messages keep their place among them.
//
// Memory. At most kMaxHeldMessages messages wait for the Convo queue; a message beyond that is
// dropped and counted as a line lost to the "convo" sink (QVReportingStats), so a flood during a
// wait cannot grow a session without bound. Start and stop tasks are never dropped.
//
// Lifetime. Queued tasks hold the worker, so a session destroyed while its Convo queue is busy or
// waiting still has its messages dropped or sent, its summary sent and its Convo session flushed.
// The completion holds only the two flags and the semaphore (and the worker weakly), so it may
// come at any time, on any thread, after the worker is gone.
//
// Thread safety: start(), stop() and handleMessage() run on the session's queue and only post
// work; everything that touches the Convo session runs on the Convo queue; the completion touches
// only the flags (atomics) and the semaphore.
#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "session/AsyncSemaphore.h"
#include "session/PooledSerialQueue.h"
#include "session/QVReportingSessionWorker.h"
#include "session/QVReportingVocabulary.h"
#include "values/FrozenPayloads.h"
#include "values/Value.h"
#include "workers/backends/QVReportingConvoSessionSummary.h"

namespace qv {

class ConvoService;
class ConvoSession;
class TaskExecutor;

// The client name the daemon gives the Convo service, and its reporting version.
inline constexpr std::string_view QVReportingClientNameQVSound = "com.korvane.qvsound";
inline constexpr std::string_view QVReportingVersionNumber = "2.1";

class QVReportingSessionConvoWorker final
    : public QVReportingSessionWorkerConsumerProtocol,
      public std::enable_shared_from_this<QVReportingSessionConvoWorker> {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionConvoWorker";
    static constexpr std::string_view kQueueName = "com.korvane.qvsound.session.convoreporting";
    // How long the start waits for the service to name the backends.
    static constexpr std::chrono::nanoseconds kBackendWait{9'000'000'000};
    // How long forwarded messages are gathered before the pool is woken for them: Convo traffic
    // goes out in batches anyway, and a wake-up per message would cost more than the message.
    static constexpr std::chrono::milliseconds kForwardingGatherDelay{5};
    // Messages held for the Convo queue at most (see Memory above).
    static constexpr std::size_t kMaxHeldMessages = 16384;
    // The Convo service's client type number for this daemon.
    static constexpr std::int64_t kClientType = 19;
    static constexpr std::string_view kUserInfoSessionIDKey = "QVReportingSessionID";

    static bool handleSingleMessageSession() { return true; }

    // Null for a service-type-11 session.
    static std::shared_ptr<QVReportingSessionConvoWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session);

    // Prepares the Convo session on the Convo queue and returns true at once (false for service
    // type 11).
    bool start() override;
    // Sends the summary, flushes and closes the Convo session, on the Convo queue.
    void stop() override;
    // Queues a copy of the message for the Convo session.
    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& message) override;

    // Whether a Convo session that found backends exists.
    bool getConvoReportingStartedState() const;
    // The serial queue of this worker's Convo work, made on first use (from the session's queue).
    PooledSerialQueue& convoReportingQueue();

    // The category as the Convo service takes it: its low 16 bits, prefixed or not.
    static std::uint16_t retrieveConvoReportingCategoryFromCategory(AudioEventCategory category);
    // Every service type is sent in batches except 12 ("apiusage"), which is sent in real time.
    static bool shouldBatchConvoReportingEventsForServiceType(AudioServiceType serviceType);

    QVReportingSessionConvoWorker(ConvoService& convo, TaskExecutor& executor, bool internalBuild);
    ~QVReportingSessionConvoWorker() override;

  private:
    // What the completion may touch, shared with it so that it can outlive the worker.
    struct Backend {
        explicit Backend(TaskExecutor& executor) : convoreportingBackendSemaphore(executor) {}
        std::atomic<bool> convoReportingSessionStarted{false};
        AsyncSemaphore convoreportingBackendSemaphore;
    };

    // Messages for one forwarding task: filled on the session's queue until the task takes them.
    struct Outbox {
        std::mutex mutex;
        FrozenPayloads payloads;                                           // guarded by mutex
        std::vector<std::pair<AudioEventCategory, AudioEventType>> kinds;  // guarded by mutex
        bool taken = false;                                                // guarded by mutex
    };

    struct StartArguments {
        Dictionary configuration;
        std::string serviceSessionName;  // the service name followed by "_session"
        AudioServiceType serviceType;
        ReporterID reporterID;
        bool isSingleMessageSession;
    };

    // The tasks of the Convo queue.
    void startTask(const StartArguments& arguments);
    void finishBackendWait(bool signalled);
    void forwardTask(Outbox& outbox);
    // summary: the kept messages' values, copied at stop; listWasEmpty: the session held no
    // message at all (then no summary is sent).
    void stopTask(const QVReportingConvoSessionSummary& summary, bool listWasEmpty,
                  ReporterID reporterID);
    void _sendMessage(QVReportingSessionMessage& message);

    ConvoService& convo_;
    TaskExecutor& executor_;
    const bool internalBuild_;
    const std::shared_ptr<Backend> backend_;
    // Made on first use, on the session's queue.
    std::unique_ptr<PooledSerialQueue> convoReportingQueue_;
    // The outbox messages go to, until a task takes it or a start or stop closes it (session's
    // queue only).
    std::shared_ptr<Outbox> outbox_;
    // Messages in the open outbox, or in the last one once it was taken (session's queue only).
    std::size_t outboxSize_ = 0;
    // Messages in outboxes not yet taken.
    std::atomic<std::size_t> heldMessages_{0};
    // Convo queue only.
    std::shared_ptr<ConvoSession> convoReportingSession_;
    std::optional<std::string> convoReportingAgentToken_;
};

}  // namespace qv
