// A program that reports through the installed client library: it makes a session, starts it,
// sends one Playback Start message, stops and destroys it, and prints what the daemon answered.
//
//   g++ -std=c++20 main.cpp $(pkg-config --cflags --libs qvreporting-client) -o report-example
//   ./report-example [system|session|BUS-ADDRESS]
#include <cstdint>
#include <cstdio>
#include <future>
#include <string>

#include "QVReportingClient.h"

using qv::client::QVReportingClient;
using qv::client::QVReportingClientError;

int main(int argc, char** argv) {
    const std::string bus = argc > 1 ? argv[1] : "system";
    // Any ID of this connection's choosing; sessions are the connection's own.
    const std::int64_t id = 4242;
    try {
        auto client = QVReportingClient::connect(bus);
        if (!client->createReportingSession(id)) {
            std::fprintf(stderr, "the daemon refused to create session %lld\n",
                         static_cast<long long>(id));
            return 1;
        }
        client->setServiceType(1, id);  // longformaudio

        // The start call is answered only when the session stops, so it goes out asynchronously.
        std::promise<bool> started;
        client->startReportingSessionAsync(id, [&](const QVReportingClientError* error, bool ok) {
            started.set_value(error == nullptr && ok);
        });

        // Playback (category 4), Start (type 1).
        client->sendMessage({{"session_output_running", sdbus::Variant(true)}}, 4, 1, {id});
        const bool stopped = client->stopReportingSession(id);
        const bool startAnswered = started.get_future().get();
        const bool destroyed = client->destroyReportingSession(id);
        std::printf("session %lld: started %s, stopped %s, destroyed %s\n",
                    static_cast<long long>(id), startAnswered ? "yes" : "no",
                    stopped ? "yes" : "no", destroyed ? "yes" : "no");
        return startAnswered && stopped && destroyed ? 0 : 1;
    } catch (const QVReportingClientError& e) {
        std::fprintf(stderr, "%s [%s]\n", e.message().c_str(), e.name().c_str());
        return e.isDaemonNotRunning() ? 3 : 1;
    }
}
