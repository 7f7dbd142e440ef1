// The user-defaults store (suites such as "com.korvane.qvsound") and the per-domain preference
// store (a domain such as "com.korvane.deskhost"): each suite or domain a dictionary of values.
// One store serves both; a suite name and a domain name are both simply a name.
//
// Thread safety: every member may be called from any thread. A value read after a write (by this
// process or another) reflects that write.
#pragma once

#include <optional>
#include <string_view>

#include "values/Value.h"

namespace qv {

class PreferenceStore {
  public:
    virtual ~PreferenceStore() = default;

    // The value under key in the suite or domain, or nothing when absent or unreadable.
    virtual std::optional<Value> value(std::string_view suite, std::string_view key) const = 0;
    // Every key and value of the suite or domain (empty when it has none).
    virtual Dictionary values(std::string_view suite) const = 0;
    // Sets a key; false (and nothing changed) when the store could not be written.
    virtual bool setValue(std::string_view suite, std::string_view key, const Value& value) = 0;
    // Removes a key; false when the store could not be written.
    virtual bool removeValue(std::string_view suite, std::string_view key) = 0;
};

}  // namespace qv
