// AudioIssueDetected::readFrom on arbitrary bytes. Beyond not crashing (ASan and UBSan watch every
// read), what it accepts must be a record: written out again it reads back equal with the same
// hash, and writing that copy gives the same bytes (the writer's form is canonical). Whatever was
// read, accepted or not, formats as text, and copies, moves and swaps keep it equal.
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <utility>

#include "workers/backends/mtx/AudioIssueDetected.h"

namespace {

using mtxmetrics::AudioIssueDetected;

void check(bool condition) {
    if (!condition) {
        __builtin_trap();
    }
}

std::string wireOf(const AudioIssueDetected& record) {
    mtxmetrics::Writer writer;
    record.writeTo(writer);
    return writer.takeData();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view bytes(reinterpret_cast<const char*>(data), size);
    mtxmetrics::Reader reader(bytes);
    AudioIssueDetected record;
    const bool accepted = record.readFrom(reader);
    check(reader.position() <= size);
    check(accepted == !reader.hasError());

    mtxmetrics::LineTextFormatter formatter;
    record.formatText(formatter, "AudioIssueDetected");
    check(!formatter.text().empty() && formatter.text().back() == '}');

    AudioIssueDetected copy = record;
    check(copy == record && copy.hash_value() == record.hash_value());
    AudioIssueDetected other;
    swap(other, copy);
    check(other == record && copy == AudioIssueDetected{});
    copy = std::move(other);
    check(copy == record);

    if (!accepted) {
        return 0;
    }
    const std::string wire = wireOf(record);
    mtxmetrics::Reader again(wire);
    AudioIssueDetected readBack;
    check(readBack.readFrom(again));
    check(again.atEnd());
    check(readBack == record);
    check(readBack.hash_value() == record.hash_value());
    check(wireOf(readBack) == wire);
    return 0;
}
