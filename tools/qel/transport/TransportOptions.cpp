#include "transport/TransportOptions.hpp"

#include <qel/common/net/IPEndpoint.hpp>

#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/OptionChecks.hpp"

namespace qel::tool {

namespace {

constexpr double kMinHandshake = 0.001;
constexpr double kMaxHandshake = 24 * 60 * 60;

CLI::Validator fingerprintValidator()
{
    return CLI::Validator(
        [](std::string& text) {
            const std::string normalized = normalizedFingerprint(text);
            if (normalized.empty()) return "'" + text + "' is not a SHA-256 fingerprint: 64 hexadecimal digits";
            text = normalized;
            return std::string();
        },
        "");
}

void addCredentialOptions(CLI::App& app, TransportOptions& options, CLI::Option* plain)
{
    CLI::Option* const directory =
        app.add_option("--credentials", options.directory,
                       "Use TLS with NAME.crt, NAME.key and root.crt from this directory, as \"qel ca\" writes them")
            ->type_name("DIR");
    CLI::Option* const name = app.add_option("--name", options.name, "Which certificate and key in that directory")
                                  ->type_name("NAME")
                                  ->check(credentialNameValidator());
    CLI::Option* const certificate =
        app.add_option("--cert", options.files.certificate, "Use TLS with this certificate")->type_name("FILE");
    CLI::Option* const key = app.add_option("--key", options.files.key, "The private key of --cert")->type_name("FILE");
    CLI::Option* const root =
        app.add_option("--root", options.files.root, "The root certificate to trust, with --cert")->type_name("FILE");
    directory->needs(name)->excludes(certificate)->excludes(key)->excludes(root)->excludes(plain);
    name->needs(directory);
    certificate->needs(key)->needs(root)->excludes(plain);
    key->needs(certificate);
    root->needs(certificate);
}

void addPeerOptions(CLI::App& app, TransportOptions& options, CLI::Option* plain)
{
    // Each of these takes one value; the next word on the command line is a separate argument.
    app.add_option("--peer-name", options.pins.names,
                   "Accept only a peer whose certificate has this common name (CN); may be repeated")
        ->type_name("CN")
        ->allow_extra_args(false)
        ->excludes(plain);
    app.add_option("--peer-fingerprint", options.pins.fingerprints,
                   "Accept only a peer whose certificate has this SHA-256 fingerprint; may be repeated")
        ->type_name("HEX")
        ->allow_extra_args(false)
        ->transform(fingerprintValidator())
        ->excludes(plain);
}

} // namespace

std::chrono::milliseconds TransportOptions::handshakeTimeout() const
{
    return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(handshakeSeconds));
}

CredentialPaths TransportOptions::paths() const { return directory.empty() ? files : credentialPaths(directory, name); }

void addTransportOptions(CLI::App& app, TransportOptions& options)
{
    CLI::Option* const plain = app.add_flag("--plain", options.plain, "Use no TLS; for loopback addresses only");
    addCredentialOptions(app, options, plain);
    addPeerOptions(app, options, plain);
    addKeyPermissionsOption(app, options.permissions);
    app.add_option("--handshake-timeout", options.handshakeSeconds,
                   "Seconds from the TCP connection to the end of the handshake")
        ->type_name("SECONDS")
        ->check(numberIn(kMinHandshake, kMaxHandshake))
        ->capture_default_str();
}

void checkTransport(const TransportOptions& options, const std::string& endpoint)
{
    checkCredentials(options);
    checkPlain(options, endpoint);
}

void checkCredentials(const TransportOptions& options)
{
    const bool hasCredentials = !options.directory.empty() || !options.files.certificate.empty();
    if (!options.plain && !hasCredentials) {
        throw CLI::ValidationError("credentials are missing: give --credentials DIR --name NAME, or --cert, --key and "
                                   "--root, or --plain for a loopback address");
    }
}

void checkPlain(const TransportOptions& options, const std::string& endpoint)
{
    if (!options.plain || isLoopback(IPEndpoint(endpoint).getAddress())) return;
    throw CLI::ValidationError(plainRefusal(endpoint));
}

std::string plainRefusal(const std::string& server)
{
    return "--plain is refused for " + server + ": it is not a loopback address";
}

std::optional<Credentials> loadCredentials(const TransportOptions& options)
{
    if (options.plain) return std::nullopt;
    return Credentials::fromFiles(options.paths(), options.permissions);
}

} // namespace qel::tool
