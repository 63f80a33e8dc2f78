#include "platform/linux/OtlpCollector.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>
#include <system_error>

#include <unistd.h>

#include <curl/curl.h>
#include <fmt/format.h>
#include <openssl/bio.h>
#include <openssl/pem.h>
#include <openssl/x509.h>

namespace mx {

namespace {

using Json = nlohmann::json;

// A collector's address: an http or https URL with a host, as curl reads it. Its
// scheme, lower-cased; empty when it is none.
std::string collectorScheme(const std::string& url)
{
    CURLU* parsed = curl_url();
    char* scheme = nullptr;
    char* host = nullptr;
    bool good = curl_url_set(parsed, CURLUPART_URL, url.c_str(), 0) == CURLUE_OK &&
        curl_url_get(parsed, CURLUPART_SCHEME, &scheme, 0) == CURLUE_OK &&
        curl_url_get(parsed, CURLUPART_HOST, &host, 0) == CURLUE_OK && host && *host &&
        (std::string_view(scheme) == "http" || std::string_view(scheme) == "https");
    std::string found = good ? scheme : "";
    curl_free(scheme);
    curl_free(host);
    curl_url_cleanup(parsed);
    return found;
}

// RFC 9110's token: what a field name may be made of.
bool isFieldName(const std::string& name)
{
    return !name.empty() && std::all_of(name.begin(), name.end(), [](unsigned char c) {
        return std::isalnum(c) || std::strchr("!#$%&'*+-.^_`|~", c);
    });
}

// Fields the exporter writes itself: a second copy would make the request ambiguous.
bool isExportersOwn(std::string name)
{
    std::transform(name.begin(), name.end(), name.begin(), [](unsigned char c) { return std::tolower(c); });
    return name == "content-type" || name == "content-encoding" || name == "content-length" || name == "host";
}

using Bio = std::unique_ptr<BIO, decltype(&BIO_free)>;

int noPassphrase(char*, int, int, void*) { return 0; }

Bio memoryBio(const std::string& contents)
{
    return Bio(BIO_new_mem_buf(contents.data(), static_cast<int>(contents.size())), &BIO_free);
}

// A PEM file is a few kilobytes, a CA bundle a few hundred.
constexpr std::size_t kLargestPem = std::size_t{4} << 20;

// What is wrong with a PEM file of `kind` ("certificate" or "key"), if anything.
std::optional<std::string> pemProblem(const OtlpCollector::Pem& pem, std::string_view kind)
{
    auto bio = memoryBio(pem.contents);
    if (kind == "key") {
        EVP_PKEY* key = PEM_read_bio_PrivateKey(bio.get(), nullptr, noPassphrase, nullptr);
        EVP_PKEY_free(key);
        return key ? std::nullopt : std::optional(fmt::format("{} holds no unencrypted PEM private key", pem.path));
    }
    X509* certificate = PEM_read_bio_X509(bio.get(), nullptr, noPassphrase, nullptr);
    X509_free(certificate);
    return certificate ? std::nullopt : std::optional(fmt::format("{} holds no PEM certificate", pem.path));
}

// A private key is its owner's (the daemon's user, or root who set it up) and its
// group's at most: one others may read is no longer private.
std::optional<std::string> keyExposure(const std::string& path, const ConfigFile::Read& read)
{
    if (read.owner != 0 && read.owner != ::geteuid())
        return fmt::format("{} is owned by uid {}: a private key must be this daemon's user's (uid {}) or root's", path,
                           read.owner, ::geteuid());
    if ((read.mode & 0027) != 0)
        return fmt::format("{} has mode {:04o}: a private key must not be readable by others nor writable by its "
                           "group (chmod 0640 or 0600)",
                           path, read.mode);
    return std::nullopt;
}

bool keyMatches(const OtlpCollector::Pem& cert, const OtlpCollector::Pem& key)
{
    auto certBio = memoryBio(cert.contents);
    auto keyBio = memoryBio(key.contents);
    X509* certificate = PEM_read_bio_X509(certBio.get(), nullptr, noPassphrase, nullptr);
    EVP_PKEY* privateKey = PEM_read_bio_PrivateKey(keyBio.get(), nullptr, noPassphrase, nullptr);
    bool matches = certificate && privateKey && X509_check_private_key(certificate, privateKey) == 1;
    X509_free(certificate);
    EVP_PKEY_free(privateKey);
    return matches;
}

bool readHeaders(ConfigFile& file, const ConfigFile::Pointer& at, OtlpCollector& collector)
{
    const Json& headers = file.document()->at(at);
    if (!file.expect(headers.is_object(), at, "an object of header names and values"))
        return false;
    bool good = true;
    for (const auto& [name, value] : headers.items()) {
        auto field = at / name;
        if (!isFieldName(name)) {
            file.fail(field, fmt::format("{}: \"{}\" is no HTTP header name", file.settingName(at), name));
            good = false;
        } else if (isExportersOwn(name)) {
            file.fail(field, fmt::format("{}: \"{}\" is the exporter's own to send", file.settingName(at), name));
            good = false;
        } else if (!file.expect(value.is_string(), field, "a string")) {
            good = false;
        } else if (value.get<std::string>().find_first_of(std::string_view("\r\n\0", 3)) != std::string::npos) {
            // Not the value itself in the message: it is a secret.
            file.fail(field, fmt::format("{} must be one line of text", file.settingName(field)));
            good = false;
        } else {
            collector.headers.emplace_back(name, value.get<std::string>());
        }
    }
    return good;
}

bool readTls(ConfigFile& file, const ConfigFile::Pointer& at, OtlpCollector& collector)
{
    const Json& tls = file.document()->at(at);
    if (!file.expect(tls.is_object(), at, "an object of ca_file, cert_file and key_file"))
        return false;
    bool good = file.onlyKeys(at, {"ca_file", "cert_file", "key_file"});
    auto readFile = [&](const char* key, std::string_view kind, OtlpCollector::Pem& into) {
        if (!tls.contains(key))
            return;
        auto setting = at / key;
        if (!file.expect(tls[key].is_string() && !tls[key].get<std::string>().empty(), setting,
                         "the name of a PEM file")) {
            good = false;
            return;
        }
        auto path = (file.path().parent_path() / tls[key].get<std::string>()).string();
        auto read = ConfigFile::readRegularFile(path, kLargestPem);
        std::optional<std::string> problem;
        if (read.outcome == ConfigFile::Read::Outcome::Missing)
            problem = path + " does not exist";
        else if (read.outcome == ConfigFile::Read::Outcome::Refused)
            problem = read.problem;
        else if (kind == "key")
            problem = keyExposure(path, read);
        OtlpCollector::Pem pem{path, std::move(read.contents)};
        if (!problem)
            problem = pemProblem(pem, kind);
        if (problem) {
            file.failSetting(setting, *problem);
            good = false;
            return;
        }
        into = std::move(pem);
    };
    readFile("ca_file", "certificate", collector.ca);
    readFile("cert_file", "certificate", collector.cert);
    readFile("key_file", "key", collector.key);
    if (good && tls.contains("cert_file") != tls.contains("key_file")) {
        file.failSetting(at, "cert_file and key_file go together");
        good = false;
    }
    if (good && !collector.cert.path.empty() && !keyMatches(collector.cert, collector.key)) {
        file.failSetting(at / "key_file",
                         fmt::format("{} is not the key of {}", collector.key.path, collector.cert.path));
        good = false;
    }
    return good;
}

} // namespace

std::optional<OtlpCollector> OtlpCollector::read(ConfigFile& file, const ConfigFile::Pointer& at)
{
    const Json& backend = file.document()->at(at);
    bool good = file.onlyKeys(at, {"type", "url", "headers", "tls", "timeout_seconds", "compression"});
    OtlpCollector collector;
    auto url = backend.find("url");
    if (url == backend.end()) {
        file.fail(at, fmt::format("{} has no url: the collector's URL", file.settingName(at)));
        return std::nullopt;
    }
    if (!file.expect(url->is_string(), at / "url", "the collector's URL, a string"))
        return std::nullopt;
    collector.url = url->get<std::string>();
    std::string scheme = collectorScheme(collector.url);
    if (scheme.empty()) {
        file.failSetting(at / "url", fmt::format("{} is no http or https URL with a host", url->dump()));
        good = false;
    }
    if (backend.contains("headers"))
        good &= readHeaders(file, at / "headers", collector);
    if (backend.contains("tls")) {
        good &= readTls(file, at / "tls", collector);
        if (scheme == "http") {
            file.failSetting(at / "tls", fmt::format("tls is for an https collector, and {} is http", collector.url));
            good = false;
        }
    }
    if (auto timeout = backend.find("timeout_seconds"); timeout != backend.end()) {
        constexpr double kLongest = 3600;
        bool holds = timeout->is_number() && timeout->get<double>() > 0 && timeout->get<double>() <= kLongest;
        if (file.expect(holds, at / "timeout_seconds", "a number of seconds above 0, at most 3600"))
            collector.timeout = std::chrono::milliseconds(static_cast<std::int64_t>(timeout->get<double>() * 1000));
        else
            good = false;
    }
    if (auto compression = backend.find("compression"); compression != backend.end()) {
        bool holds = compression->is_string() &&
            (compression->get<std::string>() == "gzip" || compression->get<std::string>() == "none");
        if (file.expect(holds, at / "compression", "\"gzip\" or \"none\""))
            collector.gzip = compression->get<std::string>() == "gzip";
        else
            good = false;
    }
    if (!good)
        return std::nullopt;
    return collector;
}

} // namespace mx
