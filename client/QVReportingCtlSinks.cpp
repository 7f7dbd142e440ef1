// qvreportctl sinks: the sink files printed (each sink across its segments, oldest first, the
// sinks merged by time), or followed.
#include <algorithm>
#include <filesystem>
#include <iostream>
#include <map>
#include <thread>

#include "QVReportingCtl.h"
#include "QVReportingCtlSupport.h"
#include "platform/SinkSegments.h"

namespace qv::ctl {

namespace {

constexpr auto kFollowInterval = std::chrono::milliseconds(100);

}  // namespace

int printSinks(const Options& options, const std::string& sink, bool follow) {
    if (!sink.empty() && !qv::client::QVReportingCtlIsSinkName(sink)) {
        throw UsageError{"not a sink name: " + sink};
    }
    const std::filesystem::path sinksDir = std::filesystem::path(options.stateDir) / "sinks";
    const auto sinkNames = [&] {
        return sink.empty() ? qv::client::QVReportingCtlListSinks(options.stateDir)
                            : std::vector<std::string>{sink};
    };
    // Each sink is read across its segments, oldest first, and followed through their renames.
    std::map<std::string, SinkLineReader> readers;
    const auto addReaders = [&] {
        for (const auto& name : sinkNames()) {
            readers.try_emplace(name, sinksDir, name, 0);
        }
    };
    addReaders();
    if (!follow) {
        if (!sink.empty() && QVReportingListSinkSegments(sinksDir, sink).empty()) {
            throw Failure{"no sink file " +
                          qv::client::QVReportingCtlSinkPath(options.stateDir, sink)};
        }
        if (readers.empty()) {
            std::cerr << "qvreportctl: no sink files in " << sinksDir.string() << std::endl;
            return 0;
        }
        // Several sinks are merged by time, so one session's lines read in order.
        struct Line {
            double time;
            std::string text;
        };
        std::vector<Line> lines;
        for (auto& [name, reader] : readers) {
            while (auto line = reader.next()) {
                const Json parsed = Json::parse(line->text, nullptr, false);
                const double time =
                    parsed.is_object() && parsed.contains("time") && parsed["time"].is_number()
                        ? parsed["time"].get<double>()
                        : 0.0;
                lines.push_back({time, qv::client::QVReportingCtlFormatSinkLine(name, line->text,
                                                                                options.json)});
            }
        }
        std::stable_sort(lines.begin(), lines.end(),
                         [](const Line& a, const Line& b) { return a.time < b.time; });
        for (const auto& line : lines) {
            std::cout << line.text << '\n';
        }
        std::cout.flush();
        return 0;
    }
    for (;;) {
        addReaders();  // sinks that appear while following are picked up
        bool any = false;
        for (auto& [name, reader] : readers) {
            while (auto line = reader.next()) {
                std::cout << qv::client::QVReportingCtlFormatSinkLine(name, line->text,
                                                                      options.json)
                          << '\n';
                any = true;
            }
        }
        if (any) {
            std::cout.flush();
        }
        std::this_thread::sleep_for(kFollowInterval);
    }
}

}  // namespace qv::ctl
