#pragma once
// One otlp-http backend of uplink.json: where its collector is and how to reach it.
// {"type": "otlp-http", "url": "https://collector.example:4318/v1/logs",
//  "headers": {"Authorization": "Bearer ..."}, "tls": {"ca_file": PATH,
//  "cert_file": PATH, "key_file": PATH}, "timeout_seconds": 15, "compression": "gzip"}
// Every file the settings name is read when the configuration is, and only then: a CA
// that does not parse is an error of the configuration, with its place, not a failure
// of every export after it; the exporter hands curl what was read, so nothing put in a
// file's place later (a FIFO) can hold it up; and a file changed at its old path is a
// changed setting. A private key others may read, or owned by another user, is
// refused, as ssh refuses one.

#include <chrono>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/linux/ConfigFile.h"

namespace mx {

struct OtlpCollector {
    static constexpr std::chrono::seconds kDefaultTimeout{15};

    std::string url;
    // Sent with every request. Their values are secrets (API keys, tokens): they
    // never reach a log line or the status view.
    std::vector<std::pair<std::string, std::string>> headers;
    // Each PEM file's path and what it held when read; empty: none (the system's trusted
    // CAs, no client certificate).
    struct Pem {
        std::string path;
        std::string contents;
        bool operator==(const Pem&) const = default;
    };
    Pem ca;
    Pem cert; // with key: the client certificate
    Pem key;
    std::chrono::milliseconds timeout = kDefaultTimeout;
    bool gzip = true;

    bool operator==(const OtlpCollector&) const = default;

    // The backend `at` points to in `file`; nothing, with an error for every bad
    // setting added, otherwise. Relative file names are taken from the file's directory.
    static std::optional<OtlpCollector> read(ConfigFile& file, const ConfigFile::Pointer& at);
};

} // namespace mx
