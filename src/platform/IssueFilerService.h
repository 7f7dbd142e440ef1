// The bug-filing prompt service (IssueFiler): given a pre-filled bug report draft, it records the
// draft and asks the person at the device to file it, naming the process the report is about and
// why they are being asked.
//
// Thread safety: createDraft may be called from any thread and never waits for the prompt. The
// completion runs once, on a thread of the service's own, never on the caller's, unless the
// implementation documents otherwise.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace qv {

// A bug report as the tracker takes it, filled in before anyone is asked.
struct IssueDraft {
    // Where in the tracker the report goes.
    struct Component {
        std::string name;
        std::string version;
        // The component's number in the tracker.
        std::int64_t identifier = 0;
    };

    std::string title;
    std::string problemDescription;
    Component component;
    // The tracker's enumeration values.
    std::int32_t reproducibility = 0;
    std::int32_t classification = 0;
    // Diagnostic extensions whose output is attached to the report when it is filed.
    std::vector<std::string> diagnosticExtensionIdentifiers;

    bool operator==(const IssueDraft&) const = default;
};

class IssueFilerService {
  public:
    // Nothing when the draft was created, else a readable description of what went wrong.
    using Completion = std::function<void(const std::optional<std::string>& error)>;

    virtual ~IssueFilerService() = default;

    // Creates the draft for processName (the process the report is about) and prompts with
    // displayReason (a short phrase saying what happened). completion may be empty.
    virtual void createDraft(const IssueDraft& draft, std::string_view processName,
                             std::string_view displayReason, Completion completion) = 0;
};

}  // namespace qv
