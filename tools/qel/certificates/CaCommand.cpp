#include "certificates/CaCommand.hpp"

#include <qel/common/security/CertificateFacts.hpp>
#include <qel/common/security/RSAPrivateKey.hpp>
#include <qel/common/security/SSLException.hpp>
#include <qel/protocol/CertificateState.hpp>
#include <qel/protocol/NameText.hpp>
#include <qel/protocol/PemContent.hpp>

#include "base/Answer.hpp"
#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/Logging.hpp"
#include "base/OptionChecks.hpp"
#include "certificates/CredentialFiles.hpp"
#include "certificates/PeriodText.hpp"
#include "certificates/SubjectText.hpp"

#include <csignal>
#include <functional>
#include <iostream>
#include <memory>
#include <string>

namespace qel::tool {

namespace {

constexpr unsigned long kRootDays = 3650;
constexpr unsigned long kLeafDays = 365;
constexpr unsigned long kMaxDays = 36525;
constexpr int kMinKeyBits = 2048;

using Clock = SSLValidityPeriod::Clock;

/// The arguments of all subcommands; each uses its own.
struct CaOptions {
    std::string directory;
    std::string name;
    std::string subject;
    unsigned long rootDays = kRootDays;
    unsigned long days = kLeafDays;
    bool force = false;
    KeyPermissions permissions = KeyPermissions::OwnerOnly;
    std::string file;
    std::string within = "30d";
    bool json = false;
    LogOptions log;

    NewFiles::Existing existing() const { return force ? NewFiles::Existing::Replace : NewFiles::Existing::Keep; }
    std::string pathOf(const std::string& fileName) const { return pathIn(directory, fileName); }
};

[[noreturn]] void refuse(const std::string& reason) { throw CommandFailure(ExitStatus::Refused, reason); }

/// Reads facts from the content of a file; errors get the file's name.
template <typename Use>
auto usingFile(const std::string& path, const Use& use)
{
    try {
        return use();
    } catch (const SSLException& error) {
        refuse(path + ": " + error.what());
    }
}

SSLCertificate loadRoot(const CaOptions& options)
{
    const std::string certificatePath = options.pathOf(certificateFile(kRootName));
    const std::string keyPath = options.pathOf(keyFile(kRootName));
    const std::string pem = readPemFile(certificatePath);
    const std::string keyPem = readKeyFile(keyPath, options.permissions);
    parseCertificate(certificatePath, pem); // for its message
    const RSAPrivateKey key = parseKey(keyPath, keyPem);
    try {
        return SSLCertificate(pem, key);
    } catch (const SSLException&) {
        refuse(keyPath + " is not the private key of " + certificatePath);
    }
}

/// Refuses a key that no end of a connection can use: the library takes RSA keys only, and OpenSSL's usual security
/// level wants 2048 bits.
void checkKey(const PublicKeyFacts& key, const std::string& owner)
{
    if (key.type == "RSA" && key.bits >= kMinKeyBits) return;
    const std::string bits = key.bits == 0 ? "" : " with " + std::to_string(key.bits) + " bits";
    refuse(owner + " has a key of type " + key.type + bits + ": connections need RSA keys with at least " +
           std::to_string(kMinKeyBits) + " bits");
}

/// Signs a request after the checks that the library leaves to its caller.
SSLCertificate issue(const SSLCertificate& root, SSLCertificateRequest& request, const CaOptions& options)
{
    checkKey(factsOf(root).key, "the root");
    checkKey(factsOf(request).key, "the request of " + options.name);
    if (!isSignatureValid(request)) {
        refuse("the request of " + options.name +
               " is not signed with its own key: the sender may not have that key, or the request was changed");
    }
    if (haveSameSubject(request, root)) {
        refuse("the subject of " + options.name +
               " equals the root's: every peer would take the certificate for self-signed and refuse it");
    }
    const Clock::time_point end = root.getValidityPeriod().getNotAfter();
    if (Clock::now() > end) {
        refuse("the root expired at " + isoTime(end) + ": no peer would accept the certificate");
    }
    return root.sign(request, SSLValidityPeriod::days(options.days));
}

void print(const CaOptions& options, const Answer& answer)
{
    if (options.json) {
        printJson(std::cout, answer.json());
    } else {
        answer.print(std::cout);
    }
}

void addName(Answer& answer, const std::string& key, const std::string& label, const NameFields& fields)
{
    auto list = nlohmann::ordered_json::array();
    for (const NameField& field : fields)
        list.push_back({{"name", field.name}, {"value", field.value}});
    answer.add(key, label, nameText(fields));
    answer.addForPrograms(key + "Fields", list);
}

void addKey(Answer& answer, const PublicKeyFacts& key)
{
    answer.add("keyType", "key type", key.type);
    answer.add("keyBits", "key bits", key.bits);
}

void addFile(Answer& answer, const std::string& key, const std::string& path)
{
    answer.addText(key + "File", key + " file", path);
}

/// The facts about an issued certificate that its recipient needs.
void addIssued(Answer& answer, const SSLCertificate& certificate)
{
    const CertificateFacts facts = factsOf(certificate);
    addName(answer, "subject", "subject", facts.subject);
    answer.add("notAfter", "valid until", isoTime(facts.validity.getNotAfter()));
    answer.add("sha256", "SHA-256", facts.fingerprint);
}

/// Warns about a certificate that outlives its root: peers refuse it once the root has expired.
void noteShortLivedRoot(const SSLCertificate& root, const SSLCertificate& issued)
{
    const Clock::time_point end = root.getValidityPeriod().getNotAfter();
    if (issued.getValidityPeriod().getNotAfter() <= end) return;
    std::cerr << "qel: note: the root expires first, at " << isoTime(end) << std::endl;
}

ExitStatus runInit(const CaOptions& options, const SSLSubject& subject)
{
    makeDirectory(options.directory);
    NewFiles files(options.directory, options.existing());
    const std::string key = keyFile(kRootName);
    const std::string certificate = certificateFile(kRootName);
    files.checkFree({key, certificate});

    const SSLCertificate root(subject, SSLValidityPeriod::days(options.rootDays));
    files.add(key, root.getPrivateKey()->getPEM(), NewFiles::Readers::Owner);
    files.add(certificate, root.getPEM(), NewFiles::Readers::Everybody);
    files.publish();

    Answer answer;
    addFile(answer, "key", options.pathOf(key));
    addFile(answer, "certificate", options.pathOf(certificate));
    addIssued(answer, root);
    print(options, answer);
    return ExitStatus::Done;
}

ExitStatus runRequest(const CaOptions& options, const SSLSubject& subject)
{
    makeDirectory(options.directory);
    NewFiles files(options.directory, options.existing());
    const std::string key = keyFile(options.name);
    const std::string csr = requestFile(options.name);
    files.checkFree({key, csr});

    const SSLCertificateRequest request(subject);
    files.add(key, request.getPrivateKey()->getPEM(), NewFiles::Readers::Owner);
    files.add(csr, request.getPEM(), NewFiles::Readers::Everybody);
    files.publish();

    Answer answer;
    addFile(answer, "key", options.pathOf(key));
    addFile(answer, "request", options.pathOf(csr));
    addName(answer, "subject", "subject", factsOf(request).subject);
    print(options, answer);
    return ExitStatus::Done;
}

ExitStatus runSign(const CaOptions& options)
{
    NewFiles files(options.directory, options.existing());
    const std::string certificate = certificateFile(options.name);
    files.checkFree({certificate});

    const SSLCertificate root = loadRoot(options);
    const std::string csr = options.pathOf(requestFile(options.name));
    const std::string pem = readPemFile(csr);
    SSLCertificateRequest request = parseRequest(csr, pem);
    const SSLCertificate issued = issue(root, request, options);
    files.add(certificate, issued.getPEM(), NewFiles::Readers::Everybody);
    files.publish();

    Answer answer;
    addFile(answer, "certificate", options.pathOf(certificate));
    addIssued(answer, issued);
    print(options, answer);
    noteShortLivedRoot(root, issued);
    return ExitStatus::Done;
}

ExitStatus runIssue(const CaOptions& options, const SSLSubject& subject)
{
    NewFiles files(options.directory, options.existing());
    const std::string key = keyFile(options.name);
    const std::string csr = requestFile(options.name);
    const std::string certificate = certificateFile(options.name);
    files.checkFree({key, csr, certificate});

    const SSLCertificate root = loadRoot(options);
    SSLCertificateRequest request(subject);
    const SSLCertificate issued = issue(root, request, options);
    files.add(key, request.getPrivateKey()->getPEM(), NewFiles::Readers::Owner);
    files.add(csr, request.getPEM(), NewFiles::Readers::Everybody);
    files.add(certificate, issued.getPEM(), NewFiles::Readers::Everybody);
    files.publish();

    Answer answer;
    addFile(answer, "key", options.pathOf(key));
    addFile(answer, "request", options.pathOf(csr));
    addFile(answer, "certificate", options.pathOf(certificate));
    addIssued(answer, issued);
    print(options, answer);
    noteShortLivedRoot(root, issued);
    return ExitStatus::Done;
}

Answer describe(const SSLCertificate& certificate)
{
    const CertificateFacts facts = factsOf(certificate);
    Answer answer;
    answer.add("kind", "kind", "certificate");
    addName(answer, "subject", "subject", facts.subject);
    addName(answer, "issuer", "issuer", facts.issuer);
    answer.add("serial", "serial", facts.serial);
    answer.add("notBefore", "valid from", isoTime(facts.validity.getNotBefore()));
    answer.add("notAfter", "valid until", isoTime(facts.validity.getNotAfter()));
    addKey(answer, facts.key);
    answer.add("sha256", "SHA-256", facts.fingerprint);
    return answer;
}

Answer describe(const SSLCertificateRequest& request)
{
    const RequestFacts facts = factsOf(request);
    Answer answer;
    answer.add("kind", "kind", "request");
    addName(answer, "subject", "subject", facts.subject);
    answer.add("signature", "signature", facts.isSignatureValid ? "valid" : "not valid");
    addKey(answer, facts.key);
    answer.add("sha256", "SHA-256", facts.fingerprint);
    return answer;
}

ExitStatus runShow(const CaOptions& options)
{
    const std::string pem = readPemFile(options.file);
    const bool isCertificate = holdsCertificate(pem);
    if (!isCertificate && !holdsRequest(pem)) {
        const std::string found = describePem(pem);
        refuse(options.file + " holds " +
               (found.empty() ? "neither a certificate nor a certificate request in PEM form"
                              : found + ", neither a certificate nor a certificate request"));
    }
    print(options, usingFile(options.file, [&] {
              return isCertificate ? describe(parseCertificate(options.file, pem))
                                   : describe(parseRequest(options.file, pem));
          }));
    return ExitStatus::Done;
}

ExitStatus statusOf(CertificateState state)
{
    switch (state) {
    case CertificateState::Fine:
        return ExitStatus::Done;
    case CertificateState::Due:
        return ExitStatus::CertificateDue;
    case CertificateState::Expired:
        return ExitStatus::CertificateExpired;
    case CertificateState::NotYetValid:
        break;
    }
    return ExitStatus::CertificateNotYetValid;
}

ExitStatus runCheck(const CaOptions& options, std::chrono::seconds within)
{
    const std::string pem = readPemFile(options.file);
    const auto validity =
        usingFile(options.file, [&] { return parseCertificate(options.file, pem).getValidityPeriod(); });
    const Clock::time_point now = Clock::now();
    const CertificateState state = stateAt(validity, now, within);

    Answer answer;
    answer.add("state", "state", stateName(state));
    answer.add("notBefore", "valid from", isoTime(validity.getNotBefore()));
    answer.add("notAfter", "valid until", isoTime(validity.getNotAfter()));
    answer.addForPrograms("secondsLeft", (validity.getNotAfter() - now).count());
    print(options, answer);
    return statusOf(state);
}

/// Calls one of the program's own parsers while the command line is read: what it refuses becomes a usage error.
template <typename Parse>
auto asUsage(const char* option, const Parse& parse)
{
    try {
        return parse();
    } catch (const std::invalid_argument& error) {
        throw CLI::ValidationError(option, error.what());
    }
}

using Options = std::shared_ptr<CaOptions>;

/// @param makeAction  called after the command line has been read; throws CLI::ValidationError for bad usage
CLI::App& addSubcommand(CLI::App& command, Action& action, const Options& options, const char* name,
                        const char* description, std::function<Action()> makeAction)
{
    CLI::App& subcommand = addCommand(command, name, description);
    subcommand.fallthrough(); // accepts the options of "ca" after the subcommand too
    subcommand.footer("The options of \"qel ca\", such as --log-level, are accepted here too.");
    addJsonOption(subcommand, options->json);
    subcommand.callback([&action, options, makeAction = std::move(makeAction)] {
        action = [options, run = makeAction()] {
            startLogging(options->log, "qel-ca.log");
            static_cast<void>(std::signal(SIGXFSZ, SIG_IGN)); // makes a file that is too large an error
            return run();
        };
    });
    return subcommand;
}

void addDirectory(CLI::App& subcommand, const Options& options)
{
    subcommand.add_option("directory", options->directory, "Directory of the credentials")
        ->type_name("DIR")
        ->required();
}

void addNameArgument(CLI::App& subcommand, const Options& options)
{
    const auto notRoot = CLI::Validator(
        [](std::string& name) {
            return name == kRootName ? std::string("'root' is reserved for the authority") : std::string();
        },
        "");
    subcommand.add_option("name", options->name, "Whose credentials: the first part of the file names")
        ->type_name("NAME")
        ->required()
        ->check(credentialNameValidator())
        ->check(notRoot);
}

void addSubject(CLI::App& subcommand, const Options& options)
{
    subcommand
        .add_option("--subject", options->subject,
                    "Subject of the certificate: CN=...[,O=...]; write a comma in a value as \\,")
        ->type_name("NAME=VALUE,...")
        ->required();
}

void addDays(CLI::App& subcommand, unsigned long& days)
{
    subcommand.add_option("--days", days, "Days until the certificate expires")
        ->type_name("DAYS")
        ->transform(integerIn(1, kMaxDays))
        ->capture_default_str();
}

void addForce(CLI::App& subcommand, const Options& options)
{
    subcommand.add_flag("--force", options->force, "Replace existing files");
}

void addFileArgument(CLI::App& subcommand, const Options& options, const char* description)
{
    subcommand.add_option("file", options->file, description)->type_name("FILE")->required()->check(fileValidator());
}

SSLSubject subjectOf(const CaOptions& options)
{
    return asUsage("--subject", [&] { return parseSubject(options.subject); });
}

void addInit(CLI::App& command, Action& action, const Options& options)
{
    CLI::App& init =
        addSubcommand(command, action, options, "init", "Make the root: a certificate and its key", [options] {
            return [options, subject = subjectOf(*options)] { return runInit(*options, subject); };
        });
    addDirectory(init, options);
    addSubject(init, options);
    addDays(init, options->rootDays);
    addForce(init, options);
}

void addRequest(CLI::App& command, Action& action, const Options& options)
{
    CLI::App& request =
        addSubcommand(command, action, options, "request", "Make a key and a request for its certificate", [options] {
            return [options, subject = subjectOf(*options)] { return runRequest(*options, subject); };
        });
    addDirectory(request, options);
    addNameArgument(request, options);
    addSubject(request, options);
    addForce(request, options);
}

void addSign(CLI::App& command, Action& action, const Options& options)
{
    CLI::App& sign = addSubcommand(command, action, options, "sign", "Issue the certificate for a request",
                                   [options] { return [options] { return runSign(*options); }; });
    addDirectory(sign, options);
    addNameArgument(sign, options);
    addDays(sign, options->days);
    addForce(sign, options);
    addKeyPermissionsOption(sign, options->permissions);
}

void addIssue(CLI::App& command, Action& action, const Options& options)
{
    CLI::App& issue = addSubcommand(
        command, action, options, "issue", "Make a key and a request, and issue the certificate",
        [options] { return [options, subject = subjectOf(*options)] { return runIssue(*options, subject); }; });
    addDirectory(issue, options);
    addNameArgument(issue, options);
    addSubject(issue, options);
    addDays(issue, options->days);
    addForce(issue, options);
    addKeyPermissionsOption(issue, options->permissions);
}

void addShow(CLI::App& command, Action& action, const Options& options)
{
    CLI::App& show = addSubcommand(command, action, options, "show", "Print a certificate or a request",
                                   [options] { return [options] { return runShow(*options); }; });
    addFileArgument(show, options, "The certificate or the request; the first one if the file has several");
}

void addCheck(CLI::App& command, Action& action, const Options& options)
{
    CLI::App& check = addSubcommand(
        command, action, options, "check",
        "Report by exit status how long a certificate is valid: 0 long enough, 10 due, 11 expired, 12 not yet valid",
        [options] {
            const auto within = asUsage("--within", [&] { return parsePeriod(options->within); });
            return [options, within] { return runCheck(*options, within); };
        });
    addFileArgument(check, options, "The certificate; the first one if the file has several");
    check
        .add_option("--within", options->within,
                    "Report due when it expires within this time: a number with s, m, h, d or w")
        ->type_name("TIME")
        ->capture_default_str();
}

} // namespace

CLI::App& addCaCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "ca", "Run a small certificate authority");
    const auto options = std::make_shared<CaOptions>();
    options->log.usual = LogLevel::Error;
    options->log.quiet = true;
    addLogOptions(command, options->log);
    command.require_subcommand(1);

    addInit(command, action, options);
    addRequest(command, action, options);
    addSign(command, action, options);
    addIssue(command, action, options);
    addShow(command, action, options);
    addCheck(command, action, options);
    return command;
}

} // namespace qel::tool
