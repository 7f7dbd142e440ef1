// qvreportctl captures: the issue captures of the state directory (logs/Audio/Captures/ID/), oldest
// first, each with what its manifest says was collected and what was not.
#include <algorithm>
#include <cmath>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <vector>

#include <fmt/format.h>

#include "QVReportingCtl.h"

namespace qv::ctl {

namespace {

std::string localTime(const Json& seconds) {
    if (!seconds.is_number()) {
        return "?";
    }
    const double t = seconds.get<double>();
    if (!std::isfinite(t)) {
        return "?";
    }
    const auto whole = static_cast<std::time_t>(t);
    std::tm tm{};
    localtime_r(&whole, &tm);
    char text[32];
    std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S", &tm);
    return text;
}

std::string text(const Json& object, const char* key) {
    if (!object.is_object()) {
        return "?";
    }
    const auto it = object.find(key);
    if (it == object.end()) {
        return "?";
    }
    return it->is_string() ? it->get<std::string>() : dump(*it);
}

struct Capture {
    std::string id;
    std::filesystem::path directory;
    Json manifest;  // null when unreadable
    double requested = 0;
};

void print(const Capture& c) {
    std::cout << c.id << "  " << c.directory.string() << '\n';
    if (!c.manifest.is_object()) {
        std::cout << "  (no readable manifest.json: the capture is incomplete)\n";
        return;
    }
    const Json& m = c.manifest;
    const Json signature = m.value("signature", Json::object());
    std::cout << "  " << text(m, "kind") << " requested " << localTime(m.value("requested", Json()))
              << ", completed " << localTime(m.value("completed", Json())) << '\n';
    std::cout << "  signature: " << text(signature, "domain") << " / " << text(signature, "type")
              << " / " << text(signature, "subtype") << " / " << text(signature, "subtypeContext")
              << ", process " << text(signature, "detectedProcess") << '\n';
    std::cout << "  processes: " << dump(m.value("processIDs", Json::array())) << '\n';
    for (const auto& item : m.value("collected", Json::array())) {
        std::cout << "  + " << text(item, "file") << ": " << text(item, "what");
        if (item.contains("lines")) {
            std::cout << " (" << text(item, "lines") << " lines)";
        }
        if (item.value("truncated", false)) {
            std::cout << " [cut at the capture's limits]";
        }
        std::cout << '\n';
    }
    for (const auto& item : m.value("notCollected", Json::array())) {
        std::cout << "  - " << text(item, "what") << ": " << text(item, "why") << '\n';
    }
}

}  // namespace

int printCaptures(const Options& options) {
    const std::filesystem::path root =
        std::filesystem::path(options.stateDir) / "logs" / "Audio" / "Captures";
    std::vector<Capture> captures;
    std::error_code ec;
    std::filesystem::directory_iterator it(root, ec);
    if (ec && ec != std::errc::no_such_file_or_directory) {
        throw Failure{fmt::format("cannot read {}: {}", root.string(), ec.message())};
    }
    for (; !ec && it != std::filesystem::directory_iterator(); it.increment(ec)) {
        if (!it->is_directory(ec)) {
            continue;
        }
        Capture c;
        c.id = it->path().filename().string();
        c.directory = it->path();
        std::ifstream in(it->path() / "manifest.json");
        if (in) {
            c.manifest = Json::parse(in, nullptr, false);
            if (c.manifest.is_discarded()) {
                c.manifest = nullptr;
            }
        }
        if (c.manifest.is_object() && c.manifest.contains("requested") &&
            c.manifest["requested"].is_number()) {
            c.requested = c.manifest["requested"].get<double>();
        }
        captures.push_back(std::move(c));
    }
    std::stable_sort(captures.begin(), captures.end(), [](const Capture& a, const Capture& b) {
        return a.requested != b.requested ? a.requested < b.requested : a.id < b.id;
    });
    if (options.json) {
        for (const Capture& c : captures) {
            emit(Json{{"id", c.id}, {"directory", c.directory.string()}, {"manifest", c.manifest}});
        }
        return 0;
    }
    if (captures.empty()) {
        std::cerr << "qvreportctl: no captures in " << root.string() << std::endl;
        return 0;
    }
    for (const Capture& c : captures) {
        print(c);
    }
    std::cout.flush();
    return 0;
}

}  // namespace qv::ctl
