#include "serve/ServeConfig.hpp"

#include <qel/protocol/PeerPins.hpp>
#include <qel/protocol/Text.hpp>

#include "base/OptionChecks.hpp"
#include "base/UsageErrors.hpp"
#include "serve/OptionSources.hpp"

#include <algorithm>
#include <cctype>
#include <limits>

namespace qel::tool {

namespace {

using qel::operator|;
using qel::operator|=;

constexpr const char* kPartition = "partition";
constexpr const char* kRule = "rule";
constexpr std::uint64_t kMaxId = std::numeric_limits<std::uint16_t>::max();
constexpr std::size_t kMaxNameBytes = 64;
constexpr std::size_t kMaxDescriptionBytes = 256;

/// The rights of one whom a partition's `access` names.
constexpr AccessRight kAccess = AccessRight::Watch | AccessRight::Type | AccessRight::Force;

const std::vector<std::string> kPartitionKeys{
    "id", "line", "description", "access", "log", "replay", "when-unattended", "start", "restart"};
const std::vector<std::string> kRuleKeys{"name", "fingerprint", "partitions", "may"};

struct RightName {
    const char* name;
    AccessRight right;
};
constexpr RightName kRights[] = {{"watch", AccessRight::Watch},
                                 {"type", AccessRight::Type},
                                 {"force", AccessRight::Force},
                                 {"broadcast", AccessRight::Broadcast},
                                 {"attributes", AccessRight::Attributes}};

const TomlEntry& require(const TomlValue& table, const char* key, const TomlPlace& place)
{
    const TomlEntry* const entry = table.find(key);
    if (entry == nullptr) failAt(place, std::string(key) + " is missing");
    return *entry;
}

bool isName(const std::string& name)
{
    return !name.empty() && name.size() <= kMaxNameBytes && std::isalpha(static_cast<unsigned char>(name[0])) != 0 &&
           std::all_of(name.begin(), name.end(), [](unsigned char character) {
               return std::isalnum(character) != 0 || character == '-' || character == '_';
           });
}

bool hasControls(const std::string& text)
{
    return std::any_of(text.begin(), text.end(), [](unsigned char byte) { return byte < 0x20 || byte == 0x7F; });
}

/// A text of at least one byte.
std::string filledTextOf(const TomlEntry& entry)
{
    std::string text = textOf(entry);
    if (text.empty()) failAt(entry.value.place, entry.key + " is empty");
    if (text.find('\0') != std::string::npos) failAt(entry.value.place, entry.key + ": has a null character");
    return text;
}

/// Common names: any texts but the empty one, which no certificate has.
void requireName(const std::string& name, const TomlEntry& entry)
{
    if (name.empty()) failAt(entry.value.place, entry.key + ": a name is empty");
}

/// Those of the texts that are fingerprints go to the one list, the others to the other.
void addPeers(AccessRule& rule, const TomlEntry& entry)
{
    for (const std::string& text : textsOf(entry)) {
        const std::string fingerprint = normalizedFingerprint(text);
        if (fingerprint.empty()) {
            requireName(text, entry);
            rule.names.push_back(text);
        } else {
            rule.fingerprints.push_back(fingerprint);
        }
    }
}

/// The rules for whom a partition's `access` names: one for the names and one for the fingerprints, because a rule with
/// both is for certificates that match both.
void addAccess(std::vector<AccessRule>& rules, const TomlEntry& entry, std::uint16_t id)
{
    AccessRule rule;
    rule.allPartitions = false;
    rule.partitions.push_back({id, id});
    rule.rights = kAccess;
    AccessRule peers;
    addPeers(peers, entry);
    rule.names = peers.names;
    rules.push_back(rule); // also without a name: nobody but the others whom rules allow it
    if (peers.fingerprints.empty()) return;
    rule.names.clear();
    rule.fingerprints = peers.fingerprints;
    rules.push_back(rule);
}

PartitionConfig readPartition(const TomlEntry& entry)
{
    if (!isName(entry.key)) {
        failAt(entry.place, quoted(entry.key) + " is not a name for a partition: a letter, then letters, digits, '_' "
                                                "and '-', at most 64");
    }
    if (entry.value.kind != TomlValue::Kind::Table) {
        failAt(entry.place, quoted(entry.key) + " is not a table: write [partition.NAME] for each partition");
    }
    const TomlValue& table = entry.value;
    requireKnownKeys(table, kPartitionKeys);
    PartitionConfig partition;
    partition.entry = entry;
    partition.name = entry.key;
    partition.id = static_cast<std::uint16_t>(integerOf(require(table, "id", entry.place), 1, kMaxId));
    partition.line = filledTextOf(require(table, "line", entry.place));
    const TomlEntry* const description = table.find("description");
    if (description == nullptr) return partition;
    partition.description = textOf(*description);
    if (partition.description.size() > kMaxDescriptionBytes) {
        failAt(description->value.place, "description: longer than 256 bytes");
    }
    if (hasControls(partition.description)) failAt(description->value.place, "description: has control characters");
    return partition;
}

std::vector<PartitionConfig> readPartitions(const TomlEntry& tables)
{
    std::vector<PartitionConfig> partitions;
    for (const TomlEntry& entry : tableOf(tables).entries) {
        PartitionConfig partition = readPartition(entry);
        for (const PartitionConfig& other : partitions) {
            if (other.id != partition.id) continue;
            failAt(entry.value.find("id")->value.place,
                   "partition " + std::to_string(partition.id) + " is " + other.name + " already");
        }
        partitions.push_back(std::move(partition));
    }
    return partitions;
}

/// An item of a rule's `partitions`: a number, a range such as "1-4", or a name.
AccessRule::Range readRange(const TomlValue& item, const std::vector<PartitionConfig>& partitions)
{
    if (item.kind != TomlValue::Kind::Text && item.kind != TomlValue::Kind::Integer) {
        failAt(item.place, std::string("partitions takes numbers, ranges and names, not ") + kindName(item.kind));
    }
    const std::size_t dash = item.text.find('-', 1);
    const bool isNumeric = item.kind == TomlValue::Kind::Integer ||
                           (!item.text.empty() && std::isdigit(static_cast<unsigned char>(item.text[0])) != 0);
    if (isNumeric) {
        const auto first = parseInteger(item.text.substr(0, dash));
        const auto last = dash == std::string::npos ? first : parseInteger(item.text.substr(dash + 1));
        if (first && last && *first >= 1 && *first <= *last && *last <= kMaxId) {
            return {static_cast<std::uint16_t>(*first), static_cast<std::uint16_t>(*last)};
        }
        failAt(item.place, quoted(item.text) + " is not a partition or a range of partitions in [1, 65535]");
    }
    std::vector<std::string> names;
    for (const PartitionConfig& partition : partitions) {
        if (partition.name == item.text) return {partition.id, partition.id};
        names.push_back(partition.name);
    }
    const std::string guess = nearestWord(item.text, names);
    failAt(item.place, "unknown partition " + quoted(item.text) +
                           (guess.empty() ? std::string() : "; did you mean " + quoted(guess) + "?"));
}

AccessRight readRights(const TomlEntry& entry)
{
    AccessRight rights = AccessRight::None;
    std::vector<std::string> names;
    for (const RightName& known : kRights)
        names.emplace_back(known.name);
    for (const TomlValue* item : itemsOf(entry)) {
        const auto found = std::find(names.begin(), names.end(), item->text);
        if (item->kind != TomlValue::Kind::Text || found == names.end()) {
            const std::string guess = nearestWord(item->text, names);
            failAt(item->place, "unknown right " + quoted(item->text) +
                                    (guess.empty() ? "; known are watch, type, force, broadcast, attributes"
                                                   : "; did you mean " + quoted(guess) + "?"));
        }
        rights |= kRights[found - names.begin()].right;
    }
    return rights;
}

/// An empty list would not limit whom the rule is for, though it looks as if it did.
void requireFilled(const std::vector<std::string>& texts, const TomlEntry& entry)
{
    if (texts.empty()) failAt(entry.value.place, entry.key + ": the list is empty; name = \"*\" is for everybody");
}

std::vector<std::string> fingerprintsOf(const TomlEntry& entry)
{
    std::vector<std::string> fingerprints;
    for (const std::string& text : textsOf(entry)) {
        const std::string fingerprint = normalizedFingerprint(text);
        if (fingerprint.empty()) {
            failAt(entry.value.place, quoted(text) + " is not a SHA-256 fingerprint: 64 hexadecimal digits");
        }
        fingerprints.push_back(fingerprint);
    }
    requireFilled(fingerprints, entry);
    return fingerprints;
}

std::vector<std::string> namesOf(const TomlEntry& entry)
{
    std::vector<std::string> names = textsOf(entry);
    requireFilled(names, entry);
    for (const std::string& name : names)
        requireName(name, entry);
    return names;
}

AccessRule readRule(const TomlValue& table, const std::vector<PartitionConfig>& partitions)
{
    if (table.kind != TomlValue::Kind::Table) failAt(table.place, "rule takes tables: write [[rule]]");
    requireKnownKeys(table, kRuleKeys);
    AccessRule rule;
    const TomlEntry* const name = table.find("name");
    const TomlEntry* const fingerprint = table.find("fingerprint");
    if (name != nullptr) rule.names = namesOf(*name);
    if (fingerprint != nullptr) rule.fingerprints = fingerprintsOf(*fingerprint);
    if (name == nullptr && fingerprint == nullptr) {
        failAt(table.place, "whom the rule is for is missing: name, fingerprint, or name = \"*\" for everybody");
    }
    rule.rights = readRights(require(table, "may", table.place));
    const TomlEntry* const chosen = table.find("partitions");
    if (chosen == nullptr) return rule;
    rule.allPartitions = false;
    for (const TomlValue* item : itemsOf(*chosen))
        rule.partitions.push_back(readRange(*item, partitions));
    return rule;
}

void printTable(std::ostream& os, const std::string& head, const TomlPlace& place, const TomlValue& table)
{
    os << '\n' << head << "  # " << place.file << ':' << place.line << '\n';
    std::vector<Setting> settings;
    for (const TomlEntry& entry : table.entries) {
        settings.push_back(
            {entry.key, tomlText(entry.value), entry.place.file + ":" + std::to_string(entry.place.line)});
    }
    printSettings(os, settings);
}

} // namespace

ServeConfig readServeConfig(const TomlValue& file, const std::vector<std::string>& optionKeys)
{
    std::vector<std::string> known = optionKeys;
    known.insert(known.end(), {kPartition, kRule});
    requireKnownKeys(file, known);
    ServeConfig config;
    if (const TomlEntry* const partitions = file.find(kPartition)) config.partitions = readPartitions(*partitions);
    if (const TomlEntry* const rules = file.find(kRule)) {
        for (const TomlValue* table : itemsOf(*rules)) {
            config.rules.push_back(readRule(*table, config.partitions));
            config.ruleTables.push_back(*table);
        }
    }
    for (const PartitionConfig& partition : config.partitions) {
        const TomlEntry* const access = partition.entry.value.find("access");
        if (access != nullptr) addAccess(config.rules, *access, partition.id);
    }
    return config;
}

void printServeConfig(std::ostream& os, const ServeConfig& config)
{
    for (const PartitionConfig& partition : config.partitions) {
        printTable(os, "[partition." + partition.name + "]", partition.entry.place, partition.entry.value);
    }
    for (const TomlValue& table : config.ruleTables)
        printTable(os, "[[rule]]", table.place, table);
}

} // namespace qel::tool
