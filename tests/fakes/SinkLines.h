// A sink file read back in a test: its lines as JSON objects in file order (keys in the order
// written), or only those whose "op" is op. A missing file has no lines.
#pragma once

#include <filesystem>
#include <fstream>
#include <string>
#include <string_view>
#include <vector>

#include <nlohmann/json.hpp>

namespace qv::test {

inline std::vector<nlohmann::ordered_json> readSinkLines(const std::filesystem::path& path,
                                                         std::string_view op = {}) {
    std::vector<nlohmann::ordered_json> lines;
    std::ifstream in(path);
    for (std::string line; std::getline(in, line);) {
        auto json = nlohmann::ordered_json::parse(line);
        if (op.empty() || json["op"] == op) {
            lines.push_back(std::move(json));
        }
    }
    return lines;
}

}  // namespace qv::test
