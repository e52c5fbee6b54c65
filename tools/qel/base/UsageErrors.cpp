#include "base/UsageErrors.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Library.hpp"

#include <algorithm>
#include <regex>
#include <vector>

namespace qel::tool {

namespace {

using Words = std::vector<std::string>;

/// The app and the subcommands that were chosen under it, outermost first.
std::vector<const CLI::App*> chosenApps(const CLI::App& app)
{
    std::vector<const CLI::App*> chosen{&app};
    for (auto next = app.get_subcommands(); !next.empty(); next = next.front()->get_subcommands())
        chosen.push_back(next.front());
    return chosen;
}

/// As it is typed: "qel call time".
std::string commandOf(const std::vector<const CLI::App*>& apps)
{
    std::string command;
    for (const CLI::App* app : apps)
        command += (command.empty() ? "" : " ") + app->get_name();
    return command;
}

Words subcommandsOf(const CLI::App& app)
{
    Words names;
    for (const CLI::App* subcommand : app.get_subcommands({}))
        names.push_back(subcommand->get_name());
    return names;
}

Words optionsOf(const CLI::App& app)
{
    Words names;
    for (const CLI::Option* option : app.get_options()) {
        for (const std::string& name : option->get_lnames())
            names.push_back("--" + name);
    }
    return names;
}

std::string unknown(const char* kind, const std::string& word, const Words& candidates, const std::string& command)
{
    const std::string guess = nearestWord(word, candidates);
    const std::string hint =
        guess.empty() ? "; see \"" + command + " --help\"" : "; did you mean " + quoted(guess) + "?";
    return std::string("unknown ") + kind + " " + quoted(word) + hint;
}

std::string unknownOption(const std::string& option, const std::vector<const CLI::App*>& apps,
                          const std::string& command)
{
    Words candidates;
    for (const CLI::App* app : apps) {
        const Words options = optionsOf(*app);
        if (std::find(options.begin(), options.end(), option) != options.end()) {
            return "write " + option + " after " + quoted(app->get_name()) + ": it is an option of that subcommand";
        }
        candidates.insert(candidates.end(), options.begin(), options.end());
    }
    return unknown("option", option, candidates, command);
}

std::string unexpectedArgument(const std::string& word, const std::string& command)
{
    return "unexpected argument " + quoted(word) + "; see \"" + command + " --help\"";
}

/// @param apps  from the app that did not know the word to the innermost one that was chosen
std::string unknownWord(const std::string& word, const std::vector<const CLI::App*>& apps, const std::string& command)
{
    if (word.size() > 1 && word.front() == '-') return unknownOption(word.substr(0, word.find('=')), apps, command);
    const Words subcommands = subcommandsOf(*apps.front());
    if (apps.size() == 1 && !subcommands.empty()) return unknown("subcommand", word, subcommands, command);
    return unexpectedArgument(word, command);
}

std::string joined(const Words& words)
{
    std::string text;
    for (const std::string& word : words)
        text += (text.empty() ? "" : ", ") + word;
    return text;
}

/// The parser's own message, put into words where it has none for a person.
std::string parserMessage(const std::string& text)
{
    static const std::regex noValue("(\\S+): 1 required (.*) missing");
    static const std::regex excluded("(\\S+) excludes (\\S+)");
    static const std::regex notConverted("Could not convert: (\\S+) = (.*)");
    static const std::regex twice("(\\S+): At Most 1 required but received [0-9]+");
    std::smatch match;
    if (std::regex_match(text, match, noValue)) return match.str(1) + " needs a value: " + match.str(2);
    if (std::regex_match(text, match, twice)) return match.str(1) + " is given more than once";
    if (std::regex_match(text, match, excluded)) return match.str(1) + " and " + match.str(2) + " exclude each other";
    if (std::regex_match(text, match, notConverted)) return match.str(1) + " does not take " + quoted(match.str(2));
    return text;
}

/// Arguments may contain line ends and more that does something to a terminal.
std::string onOneLine(const std::string& text)
{
    std::string line;
    for (const char c : text) {
        const auto byte = static_cast<unsigned char>(c);
        line += byte < 0x20 || byte == 0x7F ? printable(std::string(1, c)) : std::string(1, c);
    }
    return line;
}

} // namespace

std::string usageMessage(const CLI::App& app, const CLI::ParseError& error)
{
    const std::vector<const CLI::App*> apps = chosenApps(app);
    const std::string command = commandOf(apps);
    for (auto at = apps.begin(); at != apps.end(); ++at) {
        const Words words = (*at)->remaining();
        const auto word = std::find_if(words.begin(), words.end(), [](const auto& text) { return text != "--"; });
        if (word == words.end()) continue;
        const bool isArgument = word != words.begin(); // after "--"
        return onOneLine(isArgument ? unexpectedArgument(*word, command)
                                    : unknownWord(*word, {at, apps.end()}, command));
    }
    const std::string text = error.what();
    if (text == CLI::RequiredError::Subcommand(1).what()) {
        return "a subcommand is missing: " + joined(subcommandsOf(*apps.back())) + "; see \"" + command + " --help\"";
    }
    return onOneLine(parserMessage(text));
}

std::string nearestWord(const std::string& word, const std::vector<std::string>& candidates)
{
    constexpr std::size_t kLettersPerMistake = 3;
    constexpr std::size_t kShortestPrefix = 4;
    std::size_t best = std::max<std::size_t>(word.size() / kLettersPerMistake, 1) + 1;
    std::string found;
    for (const std::string& candidate : candidates) {
        const std::size_t distance = editDistance(word, candidate);
        if (distance >= best) continue;
        best = distance;
        found = candidate;
    }
    if (!found.empty() || word.size() < kShortestPrefix) return found;
    for (const std::string& candidate : candidates) {
        if (candidate.compare(0, word.size(), word) == 0) return candidate;
    }
    return {};
}

std::size_t editDistance(const std::string& left, const std::string& right)
{
    // distances[i][j] is that of the first i letters of the one to the first j of the other.
    std::vector<std::vector<std::size_t>> distances(left.size() + 1, std::vector<std::size_t>(right.size() + 1));
    for (std::size_t i = 0; i <= left.size(); ++i) {
        for (std::size_t j = 0; j <= right.size(); ++j) {
            if (i == 0 || j == 0) {
                distances[i][j] = i + j;
                continue;
            }
            const bool same = left[i - 1] == right[j - 1];
            const bool swapped = i > 1 && j > 1 && left[i - 1] == right[j - 2] && left[i - 2] == right[j - 1];
            distances[i][j] =
                std::min({distances[i - 1][j] + 1, distances[i][j - 1] + 1, distances[i - 1][j - 1] + (same ? 0 : 1)});
            if (swapped) distances[i][j] = std::min(distances[i][j], distances[i - 2][j - 2] + 1);
        }
    }
    return distances[left.size()][right.size()];
}

} // namespace qel::tool
