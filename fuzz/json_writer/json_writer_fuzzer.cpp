// QVReportingAppendJsonText on values of every kind made from the input (strings now and then
// raw bytes, so not always valid UTF-8), in the compact form and indented.
//
// Properties:
// - it appends to what out held and never touches what was there;
// - it refuses a value exactly when nlohmann's dump() of QVReportingValueToJson refuses it (a
//   string or key that is not valid UTF-8), and then leaves out as it was;
// - what it accepts is byte for byte what nlohmann's dump(indent) writes;
// - what it writes parses with nlohmann and converts back to afterJson(value): bytes as base64,
//   dates as doubles, non-finite numbers as null, kinds, bits of doubles and key order kept.
#include <cstddef>
#include <cstdint>
#include <string>

#include <nlohmann/json.hpp>

#include "common/FuzzSupport.h"
#include "values/ValueJson.h"

using qv::Value;
using qv::fuzz::check;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    qv::fuzz::FuzzInput in(data, size);
    const std::uint8_t mode = in.byte();
    // -1 is the compact form; 0 puts every item on its own line without indenting it.
    const int indent = static_cast<int>(mode % 6) - 1;
    const Value value = qv::fuzz::makeValue(in, 1 + (mode >> 3) % 6, (mode & 4) != 0);

    const std::string prefix = "kept\n";
    std::string ours = prefix;
    const bool written = qv::QVReportingAppendJsonText(ours, value, indent);

    std::string theirs;
    bool theirsWritten = true;
    try {
        theirs = qv::QVReportingValueToJson(value).dump(indent);
    } catch (const nlohmann::json::exception&) {
        theirsWritten = false;
    }
    check(written == theirsWritten);
    if (!written) {
        check(ours == prefix);
        return 0;
    }
    check(ours.compare(0, prefix.size(), prefix) == 0);
    const std::string text = ours.substr(prefix.size());
    check(text == theirs);

    const auto parsed = nlohmann::ordered_json::parse(text, nullptr, /*allow_exceptions=*/false);
    check(!parsed.is_discarded());
    check(qv::fuzz::sameValue(qv::QVReportingValueFromJson(parsed), qv::fuzz::afterJson(value)));
    return 0;
}
