#include "serve/PartitionChoices.hpp"

#include "base/OptionChecks.hpp"

#include <array>
#include <stdexcept>

namespace qel::tool {

namespace {

using protocol::PartitionOptions;
using protocol::RestartLine;
using protocol::StartLine;
using protocol::WhenUnattended;

/// A word of an option and what it means.
template <typename Value>
struct Word {
    const char* text;
    Value value;
};
/// In the order of the help.
template <typename Value, std::size_t kCount>
using Words = std::array<Word<Value>, kCount>;

constexpr Words<WhenUnattended, 2> kUnattended{{{"keep", WhenUnattended::Keep}, {"wait", WhenUnattended::Wait}}};
constexpr Words<StartLine, 2> kStart{{{"open", StartLine::AtFirstOpen}, {"boot", StartLine::Boot}}};
constexpr Words<RestartLine, 3> kRestart{
    {{"never", RestartLine::Never}, {"failure", RestartLine::OnFailure}, {"always", RestartLine::Always}}};

/// "never, failure or always"
template <typename Value, std::size_t kCount>
std::string listOf(const Words<Value, kCount>& words)
{
    std::string list;
    for (std::size_t i = 0; i < words.size(); ++i) {
        if (i != 0) list += i + 1 == words.size() ? " or " : ", ";
        list += words.at(i).text;
    }
    return list;
}

/// @return what is wrong with a word; empty: nothing
template <typename Value, std::size_t kCount>
std::string check(const Words<Value, kCount>& words, const std::string& word)
{
    for (const auto& known : words) {
        if (word == known.text) return {};
    }
    return "\"" + word + "\" is not " + listOf(words);
}

template <typename Value, std::size_t kCount>
Value meaning(const Words<Value, kCount>& words, const std::string& word)
{
    for (const auto& known : words) {
        if (word == known.text) return known.value;
    }
    throw std::invalid_argument(check(words, word));
}

template <typename Value, std::size_t kCount>
void addChoice(CLI::App& command, const std::string& name, std::string& word, const Words<Value, kCount>& words,
               const std::string& description)
{
    command.add_option(name, word, description + ": " + listOf(words))
        ->type_name("WHEN")
        ->check(CLI::Validator([&words](const std::string& text) { return check(words, text); }, ""))
        ->capture_default_str();
}

} // namespace

PartitionOptions PartitionChoices::options() const
{
    PartitionOptions options;
    options.replayBytes = replayBytes;
    options.unattended = meaning(kUnattended, unattended);
    options.start = meaning(kStart, start);
    options.restart = meaning(kRestart, restart);
    return options;
}

void addPartitionChoices(CLI::App& command, PartitionChoices& choices)
{
    command
        .add_option("--replay", choices.replayBytes,
                    "Bytes of each partition's newest output that are kept, and come first when a console sets up")
        ->type_name("BYTES")
        ->transform(integerIn(0, PartitionOptions::kMaxReplayBytes))
        ->capture_default_str();
    addChoice(command, "--when-unattended", choices.unattended, kUnattended,
              "What happens to output while no console takes it: it is read and kept, or the partition waits");
    addChoice(command, "--start", choices.start, kStart,
              "When the partitions' commands start: when a console opens them first, or with the server");
    addChoice(command, "--restart", choices.restart, kRestart,
              "When a command is started again after its end, without a console that opens it");
}

} // namespace qel::tool
