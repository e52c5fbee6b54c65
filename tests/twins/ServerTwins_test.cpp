// Every fault of a server is found by the cases that are about it, and by no others.

#include <qel/protocol/CommandLine.hpp>

#include "check/CheckReport.hpp"
#include "check/server/ServerCases.hpp"
#include "protocol/server/ServerFixture.hpp"
#include "twins/Twin.hpp"

#include <algorithm>
#include <cctype>
#include <cstdlib>
#include <fnmatch.h>
#include <fstream>
#include <gtest/gtest.h>
#include <iostream>
#include <map>
#include <openssl/ssl.h>
#include <set>

namespace qel::test {

namespace {

using namespace tool::check;

constexpr std::uint16_t kEcho = 1;
constexpr std::uint16_t kEnding = 2;

/// Not for a fault, however slow the machine: a case that fails by accident is tried again with this much time.
constexpr std::chrono::seconds kPatience{10};
/// What a fault that leaves something undone costs in each of its cases.
constexpr std::chrono::milliseconds kHaste{100};

/// A context whose checks are weakened, as the fault says.
class WeakContext : public SSLServerContext {
public:
    explicit WeakContext(Fault::Tls fault)
    {
        setCredentials(Authority::trusted().serverCredentials());
        if (fault == Fault::Tls::DoesNotAskForCertificates)
            ::SSL_CTX_set_verify(mContext.get(), SSL_VERIFY_NONE, nullptr);
        if (fault == Fault::Tls::AcceptsOtherRoots) {
            ::SSL_CTX_set_verify(mContext.get(), SSL_VERIFY_PEER | SSL_VERIFY_FAIL_IF_NO_PEER_CERT,
                                 [](int, X509_STORE_CTX*) { return 1; });
        }
        if (fault == Fault::Tls::AcceptsOldTls) ::SSL_CTX_set_min_proto_version(mContext.get(), TLS1_2_VERSION);
    }
};

/// A server of this project, which all twins of a test program stand before.
class Behind : public ServerFixture {
public:
    /// @param inTime  the one whose deadlines are short
    static Behind& instance(bool inTime)
    {
        static Behind* const patient = new Behind(std::chrono::seconds(60)); // they end with the process
        static Behind* const hasty = new Behind(kDeadline);
        return inTime ? *hasty : *patient;
    }
    static constexpr std::chrono::milliseconds kDeadline{300};
    IPEndpoint endpoint() const { return server->endpoints().front(); }
    void TestBody() override {}

private:
    explicit Behind(std::chrono::milliseconds deadline)
    {
        protocol::ServerOptions options = plainOptions();
        options.handshakeTimeout = deadline;
        options.frameTimeout = deadline;
        machine.addPartition(kEcho, protocol::commandLine("stty raw -echo; exec cat"));
        machine.addPartition(kEnding, protocol::commandLine("read x; exit 3"));
        make(options);
        run();
    }
};

Target targetOf(const Twin& twin, bool isProtected)
{
    Target target(protocol::ServerAddress::parse(twin.endpoint().str()));
    target.endpoints = {twin.endpoint()};
    target.timeout = kHaste;
    target.partition = kEcho;
    target.echoPartition = kEcho;
    target.endingPartition = kEnding;
    if (!isProtected) return target;
    target.credentials = Authority::trusted().clientCredentials();
    target.context = std::make_shared<SSLClientContext>();
    target.context->setCredentials(target.credentials);
    return target;
}

bool isChosen(const Fault& fault, const std::string& id)
{
    const auto matches = [&](const std::string& pattern) { return ::fnmatch(pattern.c_str(), id.c_str(), 0) == 0; };
    return fault.only.empty() || std::any_of(fault.only.begin(), fault.only.end(), matches);
}

/// The cases that must fail, by fault: tests/twins/found.txt.
const std::map<std::string, std::set<std::string>>& expectations()
{
    static const auto all = [] {
        std::map<std::string, std::set<std::string>> table;
        std::ifstream file(QEL_SOURCE_DIR "/tests/twins/found.txt");
        std::string fault;
        for (std::string line; std::getline(file, line);) {
            if (line.empty() || line.front() == '#') continue;
            if (line.front() != ' ') {
                fault = line;
                table[fault];
            } else {
                table[fault].insert(line.substr(line.find_first_not_of(' ')));
            }
        }
        return table;
    }();
    return all;
}

/// With QEL_TWINS_LIST in the environment the cases that fail are printed, in the form of found.txt.
bool isListing() { return std::getenv("QEL_TWINS_LIST") != nullptr; }

/// Without QEL_TWINS_ALL in the environment only the cases beside those that must fail are run: all of them take two
/// minutes.
bool isNear(const std::set<std::string>& expected, const std::string& id)
{
    if (isListing() || std::getenv("QEL_TWINS_ALL") != nullptr) return true;
    const auto folder = [](const std::string& name) { return name.substr(0, name.rfind('/')); };
    return std::any_of(expected.begin(), expected.end(),
                       [&](const std::string& other) { return other == id || folder(other) == folder(id); });
}

/// The cases that fail, without those that hold when they have more time.
std::set<std::string> failing(const std::set<std::string>& expected, const Cases& cases, Target target)
{
    CheckRun run(cases, 4, [&](const Case& aCase, unsigned int number) { return runCase(aCase, target, number); });
    const auto outcomes = run.run([](const Outcome&, std::size_t) { return true; });
    target.timeout = isListing() ? 2 * kHaste : kPatience;
    std::set<std::string> ids;
    unsigned int number = 1000;
    for (const Outcome& outcome : outcomes) {
        const std::string& id = outcome.test->id;
        if (outcome.result != Result::Fails) continue;
        if (expected.count(id) == 0 && runCase(*outcome.test, target, ++number).result != Result::Fails) continue;
        ids.insert(id);
    }
    // A fault may need a certain timing, which a busy machine does not always have.
    for (const Outcome& outcome : outcomes) {
        if (expected.count(outcome.test->id) == 0 || ids.count(outcome.test->id) != 0) continue;
        for (int i = 0; i < 5 && ids.count(outcome.test->id) == 0; ++i) {
            if (runCase(*outcome.test, target, ++number).result == Result::Fails) ids.insert(outcome.test->id);
        }
    }
    return ids;
}

void expectFound(const Fault& fault, bool isProtected)
{
    const auto found = expectations().find(fault.name);
    const std::set<std::string> expected = found == expectations().end() ? std::set<std::string>() : found->second;
    Cases cases;
    for (Case& aCase : serverCases()) {
        const bool isTls = aCase.id.rfind("tls/", 0) == 0;
        if (isTls == isProtected && isChosen(fault, aCase.id) && isNear(expected, aCase.id)) {
            cases.push_back(std::move(aCase));
        }
    }
    std::set<std::string> ids;
    {
        WeakContext context(fault.tls);
        const Twin twin(Behind::instance(fault.inTime).endpoint(), fault, isProtected ? &context : nullptr);
        Target target = targetOf(twin, isProtected);
        if (fault.inTime) target.deadline = Behind::kDeadline;
        ids = failing(expected, cases, target);
    }
    EXPECT_EQ(ids, expected) << fault.name;
    EXPECT_FALSE(ids.empty());
    if (!isListing()) return;
    std::cout << "LIST " << fault.name << "\n";
    for (const std::string& id : ids)
        std::cout << "LIST   " << id << "\n";
}

std::string nameOf(const ::testing::TestParamInfo<Fault>& info)
{
    std::string name;
    bool upper = true;
    for (const char c : info.param.name) {
        if (std::isalnum(static_cast<unsigned char>(c)) == 0) {
            upper = true;
            continue;
        }
        name += upper ? static_cast<char>(std::toupper(static_cast<unsigned char>(c))) : c;
        upper = false;
    }
    return name;
}

class ServerTwin : public ::testing::TestWithParam<Fault> {};
TEST_P(ServerTwin, IsFound) { expectFound(GetParam(), false); }
INSTANTIATE_TEST_SUITE_P(Faults, ServerTwin, ::testing::ValuesIn(serverFaults()), nameOf);

class TlsTwin : public ::testing::TestWithParam<Fault> {};
TEST_P(TlsTwin, IsFound) { expectFound(GetParam(), true); }
INSTANTIATE_TEST_SUITE_P(Faults, TlsTwin, ::testing::ValuesIn(tlsFaults()), nameOf);

TEST(Twins, EveryExpectationIsOfAFault)
{
    std::set<std::string> names;
    for (const auto& faults : {serverFaults(), tlsFaults()}) {
        for (const Fault& fault : faults)
            EXPECT_TRUE(names.insert(fault.name).second) << fault.name << " is there twice";
    }
    for (const auto& [name, ids] : expectations()) {
        EXPECT_EQ(names.count(name), 1U) << name;
        EXPECT_FALSE(ids.empty()) << name;
    }
}

/// What a twin does without a fault is what the server does.
void expectNothing(bool isProtected)
{
    const Fault none;
    WeakContext context(none.tls);
    const Twin twin(Behind::instance(false).endpoint(), none, isProtected ? &context : nullptr);
    Cases cases = serverCases();
    // It is the server behind the twin that has a limit, and that one knows no TLS.
    const auto isOfTheLimit = [](const Case& aCase) { return aCase.id == "robust/most-consoles"; };
    cases.erase(std::remove_if(cases.begin(), cases.end(), isOfTheLimit), cases.end());
    EXPECT_EQ(failing({}, cases, targetOf(twin, isProtected)), std::set<std::string>());
}

TEST(Twins, NothingIsFoundWithoutAFault) { expectNothing(false); }
TEST(Twins, NothingIsFoundWithoutAFaultOverTls) { expectNothing(true); }

} // namespace

void PrintTo(const Fault& fault, std::ostream* os) { *os << fault.name; }

} // namespace qel::test
