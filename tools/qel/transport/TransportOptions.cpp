#include "transport/TransportOptions.hpp"

#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLCertificate.hpp>
#include <qel/common/security/SSLException.hpp>

#include "base/Failures.hpp"
#include "base/OptionChecks.hpp"

namespace qel::tool {

namespace {

constexpr double kShortestHandshake = 0.001;
constexpr double kLongestHandshake = 24 * 60 * 60;

CLI::Validator fingerprintValidator()
{
    return CLI::Validator(
        [](std::string& text) {
            const std::string normalized = normalizedFingerprint(text);
            if (normalized.empty()) return "'" + text + "' is no SHA-256 fingerprint: 64 hexadecimal digits";
            text = normalized;
            return std::string();
        },
        "");
}

void addCredentialOptions(CLI::App& app, TransportOptions& options, CLI::Option* plain)
{
    CLI::Option* const directory =
        app.add_option("--credentials", options.directory,
                       "Use TLS, with NAME.crt, NAME.key and root.crt from this directory, as \"qel ca\" makes them")
            ->type_name("DIR");
    CLI::Option* const name = app.add_option("--name", options.name, "Whose certificate and key in that directory")
                                  ->type_name("NAME")
                                  ->check(credentialNameValidator());
    CLI::Option* const certificate =
        app.add_option("--cert", options.files.certificate, "Use TLS, with this certificate")->type_name("FILE");
    CLI::Option* const key = app.add_option("--key", options.files.key, "its private key")->type_name("FILE");
    CLI::Option* const root =
        app.add_option("--root", options.files.root, "and the root certificate to trust")->type_name("FILE");
    directory->needs(name)->excludes(certificate)->excludes(key)->excludes(root)->excludes(plain);
    name->needs(directory);
    certificate->needs(key)->needs(root)->excludes(plain);
    key->needs(certificate);
    root->needs(certificate);
}

void addPeerOptions(CLI::App& app, TransportOptions& options, CLI::Option* plain)
{
    // The values of these are taken one at a time: whatever follows is an argument of its own.
    app.add_option("--peer-name", options.pins.names,
                   "The common name (CN) that the other end's certificate must have; several: one of them")
        ->type_name("CN")
        ->allow_extra_args(false)
        ->excludes(plain);
    app.add_option("--peer-fingerprint", options.pins.fingerprints,
                   "The SHA-256 fingerprint that the other end's certificate must have; several: one of them")
        ->type_name("HEX")
        ->allow_extra_args(false)
        ->transform(fingerprintValidator())
        ->excludes(plain);
}

template <typename Use>
auto usingFile(const std::string& path, Use use)
{
    try {
        return use();
    } catch (const SSLException& error) {
        throw CommandFailure(ExitStatus::Refused, path + ": " + error.what());
    }
}

template <typename Context>
std::unique_ptr<Context> makeContext(const TransportOptions& options)
{
    if (options.plain) return nullptr;
    const CredentialPaths paths = options.paths();
    const SSLCredentials credentials = readCredentials(paths, options.permissions);
    // The context would not say which of the three it is that is not in order.
    usingFile(paths.root, [&] { return SSLCertificate(credentials.mRootCA); });
    usingFile(paths.certificate, [&] { return SSLCertificate(credentials.mCert); });
    usingFile(paths.key, [&] { return RSAPrivateKey(credentials.mKey); });
    auto context = std::make_unique<Context>();
    try {
        context->setCredentials(credentials);
    } catch (const SSLException&) {
        throw CommandFailure(ExitStatus::Refused, paths.certificate + " and " + paths.key +
                                                      " cannot be used: they do not belong together, or are too weak");
    }
    return context;
}

} // namespace

std::chrono::milliseconds TransportOptions::handshakeTimeout() const
{
    return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(handshakeSeconds));
}

CredentialPaths TransportOptions::paths() const { return directory.empty() ? files : credentialPaths(directory, name); }

void addTransportOptions(CLI::App& app, TransportOptions& options)
{
    CLI::Option* const plain =
        app.add_flag("--plain", options.plain, "Let the connection go unprotected; for loopback addresses only");
    addCredentialOptions(app, options, plain);
    addPeerOptions(app, options, plain);
    addKeyPermissionsOption(app, options.permissions);
    app.add_option("--handshake-timeout", options.handshakeSeconds,
                   "Seconds from the connection until the console is let in")
        ->type_name("SECONDS")
        ->check(numberIn(kShortestHandshake, kLongestHandshake))
        ->capture_default_str();
}

void checkTransport(const TransportOptions& options, const std::string& endpoint)
{
    const bool hasCredentials = !options.directory.empty() || !options.files.certificate.empty();
    if (!options.plain && !hasCredentials) {
        throw CLI::ValidationError("credentials are missing: give --credentials DIR --name NAME, or --cert, --key and "
                                   "--root, or --plain for a loopback address");
    }
    if (options.plain && !isLoopback(IPEndpoint(endpoint).getAddress())) {
        throw CLI::ValidationError("--plain is refused for " + endpoint + ": it is not a loopback address");
    }
}

std::unique_ptr<SSLClientContext> makeClientContext(const TransportOptions& options)
{
    return makeContext<SSLClientContext>(options);
}

std::unique_ptr<SSLServerContext> makeServerContext(const TransportOptions& options)
{
    return makeContext<SSLServerContext>(options);
}

} // namespace qel::tool
