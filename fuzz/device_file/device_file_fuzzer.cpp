// LinuxDeviceInformation reading a device file made of the input.
//
// Properties:
// - a file that is a JSON object holding no NUL byte is used and leaves no load error; anything
//   else is reported as a load error naming the file, and then describes a customer build
//   without capabilities;
// - "InternalBuild" answers the file's boolean, nothing when it is missing or not a boolean, and
//   always the override when one is given; no other key has an answer;
// - a capability is present exactly when "capabilities" is an object whose member of that name
//   is true: members of other types, names outside the object and an object of another type
//   give no capability.
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

#include <nlohmann/json.hpp>

#include "common/FuzzSupport.h"
#include "platform/linux/system/LinuxDeviceInformation.h"

using qv::fuzz::check;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    qv::fuzz::FuzzInput in(data, size);
    const std::uint8_t mode = in.byte();
    const std::string probe = qv::fuzz::validText(in, 12);
    const std::string text = in.rest();
    const std::string path = qv::fuzz::scratchDirectory() + "/device.json";
    qv::fuzz::writeFile(path, text);

    std::optional<bool> override;
    if (mode & 1) {
        override = (mode & 2) != 0;
    }
    const qv::LinuxDeviceInformation device(path, "/var/lib/qvreportd/logs", override);

    const auto json = nlohmann::json::parse(text, nullptr, /*allow_exceptions=*/false);
    // The parser stops at a NUL byte; the reader refuses text that holds one.
    const bool usable =
        !json.is_discarded() && json.is_object() && text.find('\0') == std::string::npos;
    check(device.loadError().empty() == usable);
    if (!usable) {
        check(device.loadError().find(path) != std::string::npos);
    }

    std::optional<bool> internal = override;
    if (!override && usable) {
        const auto it = json.find("InternalBuild");
        if (it != json.end() && it->is_boolean()) {
            internal = it->get<bool>();
        }
    }
    check(device.boolAnswer("InternalBuild") == internal);
    check(!device.boolAnswer(probe == "InternalBuild" ? "internalbuild" : probe));

    const nlohmann::json* capabilities = nullptr;
    if (usable) {
        if (const auto it = json.find("capabilities"); it != json.end() && it->is_object()) {
            capabilities = &*it;
        }
    }
    const auto expected = [&](const std::string& name) {
        if (capabilities == nullptr) {
            return false;
        }
        const auto it = capabilities->find(name);
        return it != capabilities->end() && it->is_boolean() && it->get<bool>();
    };
    check(device.hasCapability(probe) == expected(probe));
    if (capabilities != nullptr) {
        for (const auto& [name, value] : capabilities->items()) {
            check(device.hasCapability(name) == expected(name));
        }
    }
    return 0;
}
