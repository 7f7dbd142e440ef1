// LinuxPreferenceStore reading a suite's file made of the input, then changing it.
//
// Properties:
// - the store reads a file as its suite exactly when the file is a JSON object nested at most 64
//   deep and holds no NUL byte, and then gives the object's members as values, in the file's order;
//   anything else reads as an empty suite and is reported once, naming the file, never again for
//   the same file;
// - a change to a suite it could read writes a file that reads back as the old values after a
//   JSON round trip with the change made (a new key last, a replaced one in its place), and
//   removing the key again leaves the rest as it was;
// - a change to a suite it could not read is refused and leaves the file's bytes as they were.
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "common/FuzzSupport.h"
#include "platform/linux/system/LinuxPreferenceStore.h"
#include "values/ValueJson.h"

namespace {

using qv::Dictionary;
using qv::Value;
using qv::fuzz::check;

constexpr std::string_view kSuite = "com.korvane.qvsound.fuzz";

std::size_t depthOf(const nlohmann::ordered_json& json) {
    std::size_t deepest = 0;
    if (json.is_structured()) {
        for (const auto& item : json) {
            deepest = std::max(deepest, depthOf(item));
        }
        return deepest + 1;
    }
    return 0;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    qv::fuzz::FuzzInput in(data, size);
    const std::uint8_t mode = in.byte();
    const std::string key = qv::fuzz::validText(in, 8);
    const std::string text = in.rest();

    std::vector<std::string> problems;
    qv::LinuxPreferenceStore store(qv::fuzz::scratchDirectory(), [&](const std::string& problem) {
        problems.push_back(problem);
    });
    const std::string path = store.pathForSuite(kSuite);
    qv::fuzz::writeFile(path, text);

    const auto json = nlohmann::ordered_json::parse(text, nullptr, /*allow_exceptions=*/false);
    // The parser stops at a NUL byte; the store refuses text that holds one.
    const bool usable = !json.is_discarded() && json.is_object() && depthOf(json) <= 64 &&
                        text.find('\0') == std::string::npos;

    const Dictionary before = store.values(kSuite);
    if (usable) {
        check(problems.empty());
        check(qv::fuzz::sameDictionary(before, qv::QVReportingDictionaryFromJson(json)));
    } else {
        check(before.empty());
        check(problems.size() == 1 && problems[0].find(path) != std::string::npos);
    }
    // The same file again: the same values, nothing reported anew.
    check(qv::fuzz::sameDictionary(store.values(kSuite), before));
    check(problems.size() == (usable ? 0u : 1u));

    const Value value = (mode & 1) ? Value(static_cast<std::int64_t>(mode)) : Value(0.5);
    const bool changed = store.setValue(kSuite, key, value);
    if (!usable) {
        check(!changed);
        check(qv::fuzz::readFile(path) == text);
        return 0;
    }
    check(changed);
    Dictionary expected = *qv::fuzz::afterJson(Value(before)).asDictionary();
    expected.set(key, value);
    check(qv::fuzz::sameDictionary(store.values(kSuite), expected));

    if (mode & 2) {
        check(store.removeValue(kSuite, key));
        expected.erase(key);
        check(qv::fuzz::sameDictionary(store.values(kSuite), expected));
    }
    return 0;
}
