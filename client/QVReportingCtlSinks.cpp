// qvreportctl sinks: the sink files printed, merged by time, or followed.
#include <algorithm>
#include <filesystem>
#include <iostream>
#include <map>
#include <thread>

#include "QVReportingCtl.h"
#include "QVReportingCtlSupport.h"

namespace qv::ctl {

namespace {

constexpr auto kFollowInterval = std::chrono::milliseconds(100);

}  // namespace

int printSinks(const Options& options, const std::string& sink, bool follow) {
    if (!sink.empty() && !qv::client::QVReportingCtlIsSinkName(sink)) {
        throw UsageError{"not a sink name: " + sink};
    }
    const auto sinkNames = [&] {
        return sink.empty() ? qv::client::QVReportingCtlListSinks(options.stateDir)
                            : std::vector<std::string>{sink};
    };
    std::map<std::string, qv::client::QVReportingSinkTail> tails;
    const auto addTails = [&] {
        for (const auto& name : sinkNames()) {
            tails.try_emplace(name, qv::client::QVReportingCtlSinkPath(options.stateDir, name));
        }
    };
    addTails();
    if (!follow) {
        if (!sink.empty() &&
            !std::filesystem::exists(qv::client::QVReportingCtlSinkPath(options.stateDir, sink))) {
            throw Failure{"no sink file " +
                          qv::client::QVReportingCtlSinkPath(options.stateDir, sink)};
        }
        if (tails.empty()) {
            std::cerr << "qvreportctl: no sink files in " << options.stateDir << "/sinks"
                      << std::endl;
            return 0;
        }
        // Several files are merged by time, so one session's lines read in order.
        struct Line {
            double time;
            std::string text;
        };
        std::vector<Line> lines;
        for (auto& [name, tail] : tails) {
            for (auto& raw : tail.readNewLines()) {
                const Json parsed = Json::parse(raw, nullptr, false);
                const double time =
                    parsed.is_object() && parsed.contains("time") && parsed["time"].is_number()
                        ? parsed["time"].get<double>()
                        : 0.0;
                lines.push_back(
                    {time, qv::client::QVReportingCtlFormatSinkLine(name, raw, options.json)});
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
        addTails();  // sinks that appear while following are picked up
        bool any = false;
        for (auto& [name, tail] : tails) {
            for (auto& raw : tail.readNewLines()) {
                std::cout << qv::client::QVReportingCtlFormatSinkLine(name, raw, options.json)
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
