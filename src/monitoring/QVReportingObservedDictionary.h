// A dictionary shared between threads whose changes can be observed key by key: the system
// monitor keeps the latest state of each feature in one, and each session's system monitor worker
// observes the keys it reports.
//
// An observer is called on the thread that made the change, after the dictionary's lock is
// released, with the new value; it may read the dictionary and add or remove observers.
// removeObserver() on the thread that makes the changes guarantees no later call; from another
// thread, a call already under way may still finish.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "values/Value.h"

namespace qv {

class QVReportingObservedDictionary {
  public:
    using Observer = std::function<void(const Dictionary& newValue)>;
    using ObserverID = std::uint64_t;
    // Reads the value to store while the lock is held; nothing means "no value, no change".
    using Reader = std::function<std::optional<Dictionary>()>;

    QVReportingObservedDictionary() = default;
    QVReportingObservedDictionary(const QVReportingObservedDictionary&) = delete;
    QVReportingObservedDictionary& operator=(const QVReportingObservedDictionary&) = delete;

    // The value under key, or nothing.
    std::optional<Dictionary> valueForKey(std::string_view key) const;
    // Every key and value, in the order the keys were first stored.
    Dictionary snapshot() const;

    // Holding the lock, calls read; stores its result under key when there is one and it is not
    // equal to the value stored there. Then, with the lock released, tells the key's observers.
    // Returns whether the value was stored.
    bool updateValueForKey(std::string_view key, const Reader& read);

    // Observes one key; returns the id that removes the observer.
    ObserverID addObserver(std::string key, Observer observer);
    // Unknown ids are ignored.
    void removeObserver(ObserverID id);
    std::size_t observerCount() const;

  private:
    struct Registration {
        std::string key;
        std::shared_ptr<const Observer> observer;
    };

    mutable std::mutex mutex_;
    Dictionary values_;                             // guarded by mutex_
    std::map<ObserverID, Registration> observers_;  // guarded by mutex_
    ObserverID lastID_ = 0;                         // guarded by mutex_
};

}  // namespace qv
