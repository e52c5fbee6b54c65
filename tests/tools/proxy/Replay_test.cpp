#include <qel/protocol/MemoryStream.hpp>

#include "base/Failures.hpp"
#include "proxy/Replay.hpp"
#include "tools/decode/Capture.hpp"
#include "tools/proxy/FlowKit.hpp"
#include "tools/proxy/ProxyKit.hpp"

#include <gmock/gmock.h>
#include <sstream>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::SizeIs;
using tool::CommandFailure;
using tool::ExitStatus;
using tool::FrameView;
using tool::RecordedConnection;
using tool::Replay;
using tool::ReplayAnswer;
using tool::ReplayResult;
using tool::Way;

std::string response(unsigned int id, const std::string& payload = {}, unsigned int operation = 0x0104)
{
    return frameOf(id, payload, 0x6003, operation, 0x40);
}
std::string request(unsigned int id, const std::string& payload = {}, unsigned int operation = 0x0104)
{
    return frameOf(id, payload, 0x6003, operation, 0x80);
}

std::vector<std::string> differences(const std::string& recorded, const std::string& live)
{
    return tool::differencesOf(FrameView(recorded.data(), recorded.size()), FrameView(live.data(), live.size()));
}

class ReplayTest : public ::testing::Test {
protected:
    ReplayTest()
    {
        auto streams = protocol::makeMemoryStreams();
        near = std::move(streams.first);
        server = std::move(streams.second);
    }
    ReplayResult play(const RecordedConnection& frames)
    {
        Replay replay(*near, std::chrono::milliseconds(timeout),
                      [this](const ReplayAnswer& answer) { answers.push_back(answer); });
        return replay.play(frames);
    }
    ExitStatus failure(const RecordedConnection& frames, const std::string& reason)
    {
        try {
            static_cast<void>(play(frames));
        } catch (const CommandFailure& error) {
            EXPECT_EQ(error.what(), reason);
            return error.getExitStatus();
        }
        return ExitStatus::Done;
    }

    int timeout = 20000;
    std::unique_ptr<Stream> near;
    std::unique_ptr<Stream> server;
    std::vector<ReplayAnswer> answers;
};

TEST_F(ReplayTest, SendsTheConsolesFramesWithIdsOfItsOwnAndComparesTheAnswers)
{
    send(*server, response(1, "ab") + frameOf(99, "notice", 0x7000, 0x0B0B, 0) + response(2, "cd"));
    const ReplayResult result = play({{Way::ToServer, request(70, "x")},
                                      {Way::ToConsole, response(70, "ab")},
                                      {Way::ToConsole, frameOf(5, "n", 0x7000, 0x0B0B, 0)},
                                      {Way::ToServer, request(80, "y")},
                                      {Way::ToConsole, response(80, "cx")}});
    EXPECT_EQ(receive(*server, 66), request(1, "x") + request(2, "y"));
    EXPECT_EQ(result.sent, 2U);
    EXPECT_EQ(result.compared, 2U);
    EXPECT_EQ(result.different, 1U);
    EXPECT_EQ(result.recordedNotices, 1U);
    EXPECT_EQ(result.seenNotices, 1U);
    ASSERT_THAT(answers, SizeIs(2));
    EXPECT_THAT(answers[0].differences, IsEmpty());
    EXPECT_EQ(answers[1].number, 5U);
    EXPECT_THAT(answers[1].differences, ElementsAre("payload differs from byte 1: 64 instead of 78"));
}

TEST_F(ReplayTest, AnswersMayComeInAnotherOrder)
{
    send(*server, response(2, "second") + response(1, "first"));
    const ReplayResult result = play({{Way::ToServer, request(7)},
                                      {Way::ToServer, request(8)},
                                      {Way::ToConsole, response(7, "first")},
                                      {Way::ToConsole, response(8, "second")}});
    EXPECT_EQ(result.compared, 2U);
    EXPECT_EQ(result.different, 0U);
}

TEST_F(ReplayTest, AResponseWithoutItsRequestIsNotAwaited)
{
    EXPECT_EQ(play({{Way::ToConsole, response(7)}}).compared, 0U);
}

TEST_F(ReplayTest, NamesTheAnswerThatDoesNotCome)
{
    const RecordedConnection frames{{Way::ToServer, request(7)}, {Way::ToConsole, response(7)}};
    timeout = 10;
    EXPECT_EQ(failure(frames, "no answer in time: frame 2 of the recording, the response to ExchIntCapabilities"),
              ExitStatus::DeadlinePassed);
    server->close();
    const RecordedConnection none{{Way::ToServer, request(7)}};
    EXPECT_EQ(failure(none, "the server takes no more frames: EOF"), ExitStatus::ClosedByPeer);
}

TEST_F(ReplayTest, NamesTheAnswerBeforeWhichTheServerCloses)
{
    send(*server, response(1).substr(0, 12));
    std::thread closer([&] {
        static_cast<void>(receive(*server, 32));
        server->close();
    });
    EXPECT_EQ(failure({{Way::ToServer, request(7)}, {Way::ToConsole, response(7)}},
                      "connection lost before frame 2 of the recording, the response to ExchIntCapabilities: EOF"),
              ExitStatus::ClosedByPeer);
    closer.join();
}

TEST_F(ReplayTest, AnImpossibleLengthIsABrokenProtocol)
{
    std::string wrong = response(1);
    wrong[6] = '\x7F';
    send(*server, wrong);
    EXPECT_EQ(failure({{Way::ToServer, request(7)}, {Way::ToConsole, response(7)}},
                      "the server sends a frame that gives 32544 as its length"),
              ExitStatus::ProtocolBroken);
}

TEST(ReplayDifferences, AreNamedFieldByField)
{
    EXPECT_THAT(differences(response(1, "ab"), response(2, "ab")), IsEmpty());
    std::string other = response(1, "ab", 0x0105);
    other[23] = 4;
    other[25] = 9;
    EXPECT_THAT(differences(response(1, "ab"), other),
                ElementsAre("operation 0x0105 instead of 0x0104",
                            "status 4 (InvalidCmdSequence) instead of 0 (NoError)",
                            "status detail 0x0009 instead of 0x0000"));
    EXPECT_THAT(differences(response(1, "ab"), response(1, "abc")), ElementsAre("payload of 3 bytes instead of 2"));
    std::string reserved = response(1, "ab");
    reserved[28] = 1;
    EXPECT_THAT(differences(response(1, "ab"), reserved), IsEmpty());
}

TEST(ReplayDifferences, TheTimeOfDayMayDiffer)
{
    EXPECT_THAT(differences(response(1, "12345678", 0x0107), response(1, "87654321", 0x0107)), IsEmpty());
    EXPECT_THAT(differences(response(1, "12345678", 0x0107), response(1, "1234567", 0x0107)), SizeIs(1));
}

std::vector<RecordedConnection> recording(const std::string& bytes)
{
    std::istringstream input(bytes);
    return tool::readRecording(input);
}

TEST(ReplayRecording, TellsTheDirectionsApart)
{
    const auto connections =
        recording(frameOf(1, "", 0x6001, 1, 0) + request(1) + response(1) + frameOf(2, "abcdef", 0x6002, 0x0777, 0) +
                  frameOf(3, "abcdef", 0x7000, 0x0777, 0));
    ASSERT_THAT(connections, SizeIs(1));
    std::string ways;
    for (const tool::RecordedFrame& frame : connections[0])
        ways += frame.way == Way::ToServer ? '>' : '<';
    EXPECT_EQ(ways, "><><");
}

TEST(ReplayRecording, KeepsTheConnectionsOfACaptureApart)
{
    Capture capture;
    capture.addSegment(1, request(1));
    capture.addSegment(1, response(1), true);
    const auto connections = recording(capture.bytes());
    ASSERT_THAT(connections, SizeIs(1));
    EXPECT_EQ(connections[0].size(), 2U);
}

TEST(ReplayRecording, RefusesWhatItCannotReplay)
{
    const auto refusal = [](const std::string& bytes) {
        try {
            static_cast<void>(recording(bytes));
        } catch (const CommandFailure& error) {
            EXPECT_EQ(error.getExitStatus(), ExitStatus::Refused);
            return std::string(error.what());
        }
        return std::string("accepted");
    };
    EXPECT_EQ(refusal(""), "the recording has no frame");
    EXPECT_EQ(refusal(request(1) + request(2).substr(0, 20)),
              "the recording has a malformed frame at offset 32: the input ends after 20 of 32 bytes");
}

} // namespace

} // namespace qel::test
