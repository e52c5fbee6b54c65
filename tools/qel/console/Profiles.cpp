#include "console/Profiles.hpp"

#include <qel/protocol/Text.hpp>

#include "base/Failures.hpp"
#include "base/HomePath.hpp"
#include "base/Library.hpp"
#include "base/OptionChecks.hpp"
#include "base/UsageErrors.hpp"
#include "console/ConsoleTexts.hpp"

#include <algorithm>
#include <filesystem>
#include <iterator>
#include <limits>
#include <optional>

namespace qel::tool {

namespace {

constexpr const char* kPartitions = "partitions";
constexpr std::uint16_t kMaxPartition = std::numeric_limits<std::uint16_t>::max();

/// The nearest of the words that are known, or where they are listed.
std::string hintAt(const std::string& guess)
{
    return guess.empty() ? texts::kSeeList : filled(texts::kDidYouMean, {quoted(guess)});
}

[[noreturn]] void failUnknown(const char* text, const std::string& word, const std::vector<std::string>& known)
{
    throw CommandFailure(ExitStatus::Usage, filled(text, {quoted(word)}) + hintAt(nearestWord(word, known)));
}

Profile readProfile(const TomlEntry& entry)
{
    Profile profile{entry.key, tableOf(entry), {}};
    if (entry.key.find('/') != std::string::npos) failAt(entry.place, texts::kSlashInProfile);
    const TomlEntry* const partitions = profile.options.find(kPartitions);
    if (partitions == nullptr) return profile;
    for (const TomlEntry& each : tableOf(*partitions).entries)
        profile.partitions.emplace_back(each.key, static_cast<std::uint16_t>(integerOf(each, 0, kMaxPartition)));
    return profile;
}

const Profile& findProfile(const std::string& name, const std::vector<Profile>& profiles)
{
    std::vector<std::string> names;
    for (const Profile& profile : profiles) {
        if (profile.name == name) return profile;
        names.push_back(profile.name);
    }
    failUnknown(texts::kNoProfile, name, names);
}

std::uint16_t findPartition(const std::string& name, const Profile& profile)
{
    std::vector<std::string> names;
    for (const auto& partition : profile.partitions) {
        if (partition.first == name) return partition.second;
        names.push_back(profile.name + "/" + partition.first);
    }
    const std::optional<std::uint64_t> number = parseInteger(name);
    if (number && *number <= kMaxPartition) return static_cast<std::uint16_t>(*number);
    failUnknown(texts::kNoPartition, profile.name + "/" + name, names);
}

/// The options that are for one run. The order of the steps of a script counts, and keys of a table have none.
constexpr const char* kOfOneRun[] = {"help", "version", "send", "expect", "exec"};

/// The long names of the options that a profile can set.
std::vector<std::string> optionNames(const CLI::App& command)
{
    std::vector<std::string> names{kPartitions};
    for (const CLI::Option* option : command.get_options()) {
        for (const std::string& name : option->get_lnames()) {
            if (std::find(std::begin(kOfOneRun), std::end(kOfOneRun), name) == std::end(kOfOneRun))
                names.push_back(name);
        }
    }
    return names;
}

/// Sets one option as the parser would.
void setOption(CLI::Option& option, const TomlEntry& entry)
{
    if (option.count() > 0) return; // the command line comes first
    try {
        if (entry.value.kind == TomlValue::Kind::Boolean && option.get_items_expected_max() == 0) {
            if (!flagOf(entry)) return;
            option.add_result("true");
        } else {
            for (const TomlValue* item : itemsOf(entry))
                option.add_result(expandHome(item->text));
        }
        option.run_callback();
    } catch (const CLI::ParseError& error) {
        failAt(entry.place, error.what());
    }
}

} // namespace

std::string Profile::option(const std::string& key) const
{
    const TomlEntry* const entry = options.find(key);
    return entry == nullptr ? std::string() : entry->value.text;
}

std::string profilesPath()
{
    const std::string configuration = environmentValue("XDG_CONFIG_HOME");
    if (!configuration.empty()) return configuration + "/qel/config.toml";
    const std::string home = environmentValue("HOME");
    return home.empty() ? home : home + "/.config/qel/config.toml";
}

std::vector<Profile> readProfiles(const std::string& path)
{
    std::error_code error; // a file that cannot be examined is read, which says why
    if (path.empty() || (!std::filesystem::exists(path, error) && !error)) return {};
    const TomlValue file = readToml(path);
    requireKnownKeys(file, {"profile"});
    std::vector<Profile> profiles;
    const TomlEntry* const table = file.find("profile");
    if (table == nullptr) return profiles;
    for (const TomlEntry& entry : tableOf(*table).entries)
        profiles.push_back(readProfile(entry));
    return profiles;
}

bool namesProfile(const std::string& target) { return target.find('/') != std::string::npos; }

std::uint16_t applyProfile(const std::string& target, const std::vector<Profile>& profiles, CLI::App& command)
{
    const std::size_t slash = target.find('/');
    const Profile& profile = findProfile(target.substr(0, slash), profiles);
    const std::uint16_t partition = findPartition(target.substr(slash + 1), profile);
    requireKnownKeys(profile.options, optionNames(command));
    for (const TomlEntry& entry : profile.options.entries) {
        if (entry.key != kPartitions) setOption(*findOption(command, entry.key), entry);
    }
    return partition;
}

void failNoPartition(const std::string& word, const std::vector<Profile>& profiles)
{
    std::vector<std::string> words;
    std::vector<std::string> targets; // that the words stand for
    for (const Profile& profile : profiles) {
        for (const auto& partition : profile.partitions) {
            words.push_back(partition.first);
            targets.push_back(profile.name + "/" + partition.first);
        }
        words.push_back(profile.name);
        targets.push_back(profile.name + "/PARTITION");
    }
    const auto guess = std::find(words.begin(), words.end(), nearestWord(word, words));
    const std::string target = guess == words.end() ? "" : targets[static_cast<std::size_t>(guess - words.begin())];
    throw CommandFailure(ExitStatus::Usage, filled(texts::kNotAPartition, {quoted(word)}) + hintAt(target));
}

} // namespace qel::tool
