#include "monitoring/QVReportingObservedDictionary.h"

#include <memory>
#include <utility>
#include <vector>

namespace qv {

std::optional<Dictionary> QVReportingObservedDictionary::valueForKey(std::string_view key) const {
    std::lock_guard lock(mutex_);
    const Value* value = values_.find(key);
    const Dictionary* dictionary = value ? value->asDictionary() : nullptr;
    return dictionary ? std::optional<Dictionary>(*dictionary) : std::nullopt;
}

Dictionary QVReportingObservedDictionary::snapshot() const {
    std::lock_guard lock(mutex_);
    return values_;
}

bool QVReportingObservedDictionary::updateValueForKey(std::string_view key, const Reader& read) {
    std::vector<std::shared_ptr<const Observer>> toTell;
    Dictionary stored;
    {
        std::lock_guard lock(mutex_);
        std::optional<Dictionary> fresh = read();
        if (!fresh) {
            return false;
        }
        const Value* current = values_.find(key);
        const Dictionary* currentDictionary = current ? current->asDictionary() : nullptr;
        if (currentDictionary != nullptr && *currentDictionary == *fresh) {
            return false;
        }
        stored = *fresh;
        values_.set(key, Value(std::move(*fresh)));
        for (const auto& [id, registration] : observers_) {
            if (registration.key == key) {
                toTell.push_back(registration.observer);
            }
        }
    }
    for (const auto& observer : toTell) {
        (*observer)(stored);
    }
    return true;
}

QVReportingObservedDictionary::ObserverID QVReportingObservedDictionary::addObserver(
    std::string key, Observer observer) {
    auto shared = std::make_shared<const Observer>(std::move(observer));
    std::lock_guard lock(mutex_);
    const ObserverID id = ++lastID_;
    observers_.emplace(id, Registration{std::move(key), std::move(shared)});
    return id;
}

void QVReportingObservedDictionary::removeObserver(ObserverID id) {
    std::shared_ptr<const Observer> released;
    {
        std::lock_guard lock(mutex_);
        auto it = observers_.find(id);
        if (it == observers_.end()) {
            return;
        }
        // Destroyed outside the lock: an observer's captures may hold the last reference to
        // something whose destructor calls back in.
        released = std::move(it->second.observer);
        observers_.erase(it);
    }
}

std::size_t QVReportingObservedDictionary::observerCount() const {
    std::lock_guard lock(mutex_);
    return observers_.size();
}

}  // namespace qv
