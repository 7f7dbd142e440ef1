#include "QVReportingExportConnection.h"

#include <algorithm>
#include <fstream>
#include <vector>

namespace qv::exporter {

namespace {

// The public key of an nkey file: the line that is a user's key ('U' and 55 more characters);
// the library reads the seed from the same file.
std::string nkeyPublicKey(const std::string& file) {
    std::ifstream in(file);
    for (std::string line; std::getline(in, line);) {
        line.erase(0, line.find_first_not_of(" \t"));
        line.erase(line.find_last_not_of(" \t\r") + 1);
        if (line.size() == 56 && line[0] == 'U') {
            return line;
        }
    }
    return {};
}

}  // namespace

std::string QVReportingExportNatsError(natsStatus status) {
    const char* last = nats_GetLastError(nullptr);
    std::string text = natsStatus_GetText(status);
    if (last && *last && text != last) {
        text += std::string(": ") + last;
    }
    return text;
}

natsOptions* QVReportingExportNatsOptions(const QVReportingExportServerSettings& settings,
                                          const char* name, std::string& error) {
    natsOptions* options = nullptr;
    // The first failure is the one worth reporting; later steps are skipped.
    const auto step = [&](natsStatus status, const char* what) {
        if (error.empty() && status != NATS_OK) {
            error = std::string(what) + ": " + QVReportingExportNatsError(status);
        }
    };
    error.clear();
    step(natsOptions_Create(&options), "options");
    if (!error.empty()) {
        return nullptr;
    }
    // One URL each: libnats 3.4 connected to none of a comma-separated list given as one URL.
    std::vector<std::string> urls;
    for (std::size_t start = 0; start <= settings.urls.size();) {
        const auto comma = std::min(settings.urls.find(',', start), settings.urls.size());
        if (comma > start) {
            urls.push_back(settings.urls.substr(start, comma - start));
        }
        start = comma + 1;
    }
    std::vector<const char*> servers;
    for (const auto& url : urls) {
        servers.push_back(url.c_str());
    }
    if (servers.empty()) {
        error = "--nats-url: no server";
    }
    step(natsOptions_SetServers(options, servers.data(), static_cast<int>(servers.size())),
         "--nats-url");
    step(natsOptions_SetName(options, name), "name");
    if (!settings.credsFile.empty()) {
        step(natsOptions_SetUserCredentialsFromFiles(options, settings.credsFile.c_str(), nullptr),
             "--creds");
    }
    if (!settings.nkeyFile.empty() && error.empty()) {
        const std::string key = nkeyPublicKey(settings.nkeyFile);
        if (key.empty()) {
            error = "--nkey: no user public key (a line starting with U) in " + settings.nkeyFile;
        }
        step(natsOptions_SetNKeyFromSeed(options, key.c_str(), settings.nkeyFile.c_str()),
             "--nkey");
    }
    if (!settings.tlsCAFile.empty()) {
        step(natsOptions_LoadCATrustedCertificates(options, settings.tlsCAFile.c_str()),
             "--tls-ca");
    }
    if (!error.empty()) {
        natsOptions_Destroy(options);
        return nullptr;
    }
    return options;
}

}  // namespace qv::exporter
