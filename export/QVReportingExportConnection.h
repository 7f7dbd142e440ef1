// How the exporter and `qvreportctl fleet` reach the NATS servers: the URLs (a comma-separated
// list; tls:// for TLS), the credentials (a creds file, or an nkey file) and the CA that signed
// the servers' certificates.
//
// Thread safety: the free function may be called from any thread.
#pragma once

#include <chrono>
#include <string>

#include <nats/nats.h>

namespace qv::exporter {

struct QVReportingExportServerSettings {
    std::string urls = "nats://127.0.0.1:4222";
    std::string credsFile;  // a creds file (user JWT and seed), or
    std::string nkeyFile;   // a file with the user's public nkey (U...) and its seed (SU...)
    std::string tlsCAFile;  // the servers' CA, when TLS is used
    std::string stream = "QVREPORTING";
    int replicas = 1;
    // The stream's duplicate window: longer than any resend takes (the acknowledgement wait, the
    // longest back-off, and a restart of the exporter).
    std::chrono::seconds duplicateWindow{600};
};

// Options for a connection with the servers and credentials of settings, named name; the caller
// destroys them (natsOptions_Destroy). Null, with error filled, when a setting is refused.
natsOptions* QVReportingExportNatsOptions(const QVReportingExportServerSettings& settings,
                                          const char* name, std::string& error);

// The library's text for status, with its last error's detail.
std::string QVReportingExportNatsError(natsStatus status);

}  // namespace qv::exporter
