#include "QVReportingCtlCompletion.h"

#include <algorithm>
#include <filesystem>
#include <iostream>
#include <string_view>

#include "QVReportingCtlSupport.h"
#include "platform/SinkSegments.h"

namespace qv::ctl {

namespace {

namespace fs = std::filesystem;

// What the value of an option or a positional argument is, where the shell can help.
enum class ValueKind { None, Bus, Files, Directories, Sinks, Suites };

// Keyed by the command that owns the argument (empty: any command) and the argument's name as
// the command line names it ("--bus", or a positional's "NAME").
struct ValueRule {
    std::string_view command;
    std::string_view argument;
    ValueKind kind;
};

constexpr ValueRule kValueRules[] = {
    {"", "--bus", ValueKind::Bus},         {"", "--state-dir", ValueKind::Directories},
    {"replay", "FILE", ValueKind::Files},  {"sinks", "NAME", ValueKind::Sinks},
    {"tail", "--sink", ValueKind::Sinks},  {"read", "SUITE", ValueKind::Suites},
    {"write", "SUITE", ValueKind::Suites}, {"delete", "SUITE", ValueKind::Suites},
    {"", "--creds", ValueKind::Files},     {"", "--nkey", ValueKind::Files},
    {"", "--tls-ca", ValueKind::Files},
};

ValueKind valueKind(const CLI::App& command, const std::string& argument) {
    for (const auto& rule : kValueRules) {
        if (rule.argument == argument &&
            (rule.command.empty() || rule.command == command.get_name())) {
            return rule.kind;
        }
    }
    return ValueKind::None;
}

bool hidden(const CLI::App* command) {
    return command->get_group().empty();
}

// A visible subcommand of command by name, or null.
const CLI::App* subcommand(const CLI::App& command, const std::string& name) {
    const auto found = command.get_subcommands(
        [&](const CLI::App* sub) { return !hidden(sub) && sub->get_name() == name; });
    return found.empty() ? nullptr : found.front();
}

// The commands whose options apply in command: every command of qvreportctl falls through to
// its parents, so the global options (--bus, --json) may come after a subcommand.
std::vector<const CLI::App*> scopes(const CLI::App& command) {
    std::vector<const CLI::App*> out;
    for (const CLI::App* c = &command; c != nullptr; c = c->get_parent()) {
        out.push_back(c);
        if (!c->get_fallthrough()) {
            break;
        }
    }
    return out;
}

const CLI::Option* namedOption(const CLI::App& command, const std::string& name) {
    for (const CLI::App* scope : scopes(command)) {
        for (const CLI::Option* option : scope->get_options()) {
            if (option->nonpositional() && option->check_name(name)) {
                return option;
            }
        }
    }
    return nullptr;
}

bool takesValue(const CLI::Option& option) {
    return option.get_type_size() > 0;
}

std::vector<std::string> positionals(const CLI::App& command) {
    std::vector<std::string> out;
    for (const CLI::Option* option : command.get_options()) {
        if (!option->nonpositional()) {
            out.push_back(option->get_name());
        }
    }
    return out;
}

// Names of the regular files in dir that end with suffix, suffix cut off, sorted.
std::vector<std::string> stems(const fs::path& dir, std::string_view suffix) {
    std::vector<std::string> out;
    std::error_code error;
    for (fs::directory_iterator it(dir, error), end; !error && it != end; it.increment(error)) {
        const std::string name = it->path().filename().string();
        if (name.size() > suffix.size() && name.ends_with(suffix) && name.front() != '.') {
            out.push_back(name.substr(0, name.size() - suffix.size()));
        }
    }
    std::sort(out.begin(), out.end());
    return out;
}

std::vector<std::string> values(ValueKind kind, const std::string& stateDir) {
    switch (kind) {
        case ValueKind::Bus:
            return {"system", "session"};
        case ValueKind::Files:
            return {"@files"};
        case ValueKind::Directories:
            return {"@dirs"};
        case ValueKind::Sinks:
            return QVReportingListSinks(fs::path(stateDir) / "sinks");
        case ValueKind::Suites:
            return stems(fs::path(stateDir) / "defaults", ".json");
        case ValueKind::None:
            break;
    }
    return {};
}

}  // namespace

int QVReportingCtlComplete(const CLI::App& app, const std::vector<std::string>& words) {
    if (words.empty()) {
        return 0;
    }
    const std::string& current = words.back();
    const CLI::App* command = &app;
    std::size_t positional = 0;
    std::string stateDir;
    const CLI::Option* pendingValue = nullptr;  // the option whose value is the current word
    for (std::size_t i = 0; i + 1 < words.size(); ++i) {
        const std::string& word = words[i];
        if (word.size() > 1 && word.front() == '-') {
            const auto equals = word.find('=');
            const CLI::Option* option = namedOption(*command, word.substr(0, equals));
            if (option == nullptr || !takesValue(*option) || equals != std::string::npos) {
                if (option != nullptr && option->check_name("--state-dir")) {
                    stateDir = word.substr(equals + 1);
                }
                continue;
            }
            std::size_t value = i + 1;
            if (value + 1 < words.size() && words[value] == "=") {
                ++value;  // bash splits "--option=value" at the '='
            }
            if (value + 1 == words.size()) {
                pendingValue = option;
            } else if (option->check_name("--state-dir")) {
                stateDir = words[value];
            }
            i = value;
            continue;
        }
        if (const CLI::App* sub = subcommand(*command, word)) {
            command = sub;
            positional = 0;
            continue;
        }
        ++positional;
    }
    if (stateDir.empty()) {
        stateDir = client::QVReportingCtlDefaultStateDirectory();
    }

    std::vector<std::string> candidates;
    if (pendingValue != nullptr) {
        candidates = values(valueKind(*command, pendingValue->get_lnames().empty()
                                                    ? pendingValue->get_name()
                                                    : "--" + pendingValue->get_lnames().front()),
                            stateDir);
    } else if (!current.empty() && current.front() == '-') {
        for (const CLI::App* scope : scopes(*command)) {
            for (const CLI::Option* option : scope->get_options()) {
                if (!option->nonpositional() || option->get_group().empty()) {
                    continue;
                }
                for (const auto& name : option->get_lnames()) {
                    candidates.push_back("--" + name);
                }
                for (const auto& name : option->get_snames()) {
                    candidates.push_back("-" + name);
                }
            }
        }
        // Every command has its own --help.
        std::sort(candidates.begin(), candidates.end());
        candidates.erase(std::unique(candidates.begin(), candidates.end()), candidates.end());
    } else {
        for (const CLI::App* sub : command->get_subcommands({})) {
            if (!hidden(sub)) {
                candidates.push_back(sub->get_name());
            }
        }
        const auto names = positionals(*command);
        if (!names.empty()) {
            // A list (IDS) takes every remaining word.
            const std::string& name = names[std::min(positional, names.size() - 1)];
            if (positional < names.size() ||
                command->get_option(name)->get_items_expected_max() > 1) {
                const auto more = values(valueKind(*command, name), stateDir);
                candidates.insert(candidates.end(), more.begin(), more.end());
            }
        }
    }
    const bool askShell = candidates.size() == 1 && candidates.front().front() == '@';
    for (const auto& candidate : candidates) {
        if (askShell || candidate.starts_with(current)) {
            std::cout << candidate << '\n';
        }
    }
    return 0;
}

}  // namespace qv::ctl
