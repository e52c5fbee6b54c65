// The library has floors: a file includes only its own floor and those below it. floors.txt beside this file is the
// table; these tests hold the files on disk against it. The program has rooms that are checked in the same way, below.

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <map>
#include <set>
#include <sstream>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::ThrowsMessage;

namespace {

struct FloorTable {
    std::map<std::string, int> floors;                                  // by room: "io/Stream"
    std::vector<std::pair<std::string, std::vector<std::string>>> only; // system header or folder, and who may have it
};

FloorTable parseTable(std::istream& text)
{
    FloorTable table;
    std::string line;
    while (std::getline(text, line)) {
        std::istringstream words(line.substr(0, line.find('#')));
        std::string first;
        if (!(words >> first)) continue;

        std::vector<std::string> rest;
        for (std::string word; words >> word;)
            rest.push_back(word);
        if (first == "only") {
            if (rest.size() < 2) throw std::runtime_error("a header and a room are needed: " + line);
            table.only.emplace_back(rest.front(), std::vector<std::string>(rest.begin() + 1, rest.end()));
            continue;
        }
        const int floor = std::stoi(first);
        for (const std::string& room : rest)
            if (!table.floors.emplace(room, floor).second) throw std::runtime_error("is listed twice: " + room);
    }
    return table;
}

FloorTable parseTable(const std::string& text)
{
    std::istringstream stream(text);
    return parseTable(stream);
}

bool startsWith(const std::string& text, const std::string& start) { return text.compare(0, start.size(), start) == 0; }

// "poll.h" covers itself, "net/" everything in that folder.
bool covers(const std::string& pattern, const std::string& name)
{
    return pattern.back() == '/' ? startsWith(name, pattern) : name == pattern;
}

std::string withoutEnding(const std::string& name)
{
    for (const char* ending : {".hpp.in", ".hpp", ".cpp"}) {
        const std::string tail(ending);
        if (name.size() > tail.size() && name.compare(name.size() - tail.size(), tail.size(), tail) == 0)
            return name.substr(0, name.size() - tail.size());
    }
    return name;
}

struct Include {
    std::string name;
    bool ours; // <qel/common/...>, whose name is kept without that, or "..."
};

std::vector<Include> includesOf(const std::string& source)
{
    std::vector<Include> result;
    std::istringstream lines(source);
    std::string line;
    while (std::getline(lines, line)) {
        line.erase(std::remove_if(line.begin(), line.end(), [](char c) { return c == ' ' || c == '\t'; }), line.end());
        const std::string directive = "#include";
        if (!startsWith(line, directive) || line.size() < directive.size() + 2) continue;

        const char open = line[directive.size()];
        const char close = open == '<' ? '>' : '"';
        const std::size_t begin = directive.size() + 1;
        const std::string name = line.substr(begin, line.find(close, begin) - begin);
        const std::string prefix = "qel/common/";
        if (startsWith(name, prefix)) {
            result.push_back({name.substr(prefix.size()), true});
        } else {
            result.push_back({name, open == '"'});
        }
    }
    return result;
}

/// @param room    of the file: "io/Stream"
/// @param source  its text
/// @return what is wrong with its includes, one sentence each
std::vector<std::string> violations(const FloorTable& table, const std::string& room, const std::string& source)
{
    const auto own = table.floors.find(room);
    if (own == table.floors.end()) return {room + " is not on any floor"};

    std::vector<std::string> result;
    for (const Include& include : includesOf(source)) {
        if (include.ours) {
            const auto other = table.floors.find(withoutEnding(include.name));
            if (other == table.floors.end()) {
                result.push_back(room + " includes " + include.name + ", which is not on any floor");
            } else if (other->second > own->second) {
                result.push_back(room + " (floor " + std::to_string(own->second) + ") includes " + include.name +
                                 " (floor " + std::to_string(other->second) + ")");
            }
            continue;
        }
        for (const auto& [header, rooms] : table.only) {
            if (!covers(header, include.name)) continue;
            const bool allowed = std::any_of(rooms.begin(), rooms.end(),
                                             [&room = room](const std::string& who) { return covers(who, room); });
            if (!allowed) result.push_back(room + " includes <" + include.name + ">, which is wrapped elsewhere");
        }
    }
    return result;
}

struct LibraryFile {
    std::string path;
    std::string room;
};

std::vector<LibraryFile> libraryFiles()
{
    std::vector<LibraryFile> files;
    for (const char* folder : {"headers/include/qel/common", "common"}) {
        const std::filesystem::path root = std::filesystem::path(QEL_SOURCE_DIR) / folder;
        for (const auto& entry : std::filesystem::recursive_directory_iterator(root)) {
            if (!entry.is_regular_file()) continue;
            const std::string name = entry.path().lexically_relative(root).string();
            const std::string room = withoutEnding(name);
            if (room != name) files.push_back({entry.path().string(), room});
        }
    }
    return files;
}

FloorTable tableOnDisk()
{
    std::ifstream file(QEL_SOURCE_DIR "/tests/meta/floors.txt");
    if (!file) throw std::runtime_error("floors.txt cannot be read");
    return parseTable(file);
}

TEST(IncludeFloors, NoFileOfTheLibraryClimbs)
{
    const FloorTable table = tableOnDisk();
    const std::vector<LibraryFile> files = libraryFiles();
    ASSERT_GT(files.size(), 80U); // the folders were found
    for (const LibraryFile& file : files) {
        std::ifstream stream(file.path);
        std::ostringstream text;
        text << stream.rdbuf();
        EXPECT_THAT(violations(table, file.room, text.str()), IsEmpty()) << file.path;
    }
}

TEST(IncludeFloors, EveryRoomOfTheTableHasAFile)
{
    std::set<std::string> rooms;
    for (const LibraryFile& file : libraryFiles())
        rooms.insert(file.room);
    for (const auto& [room, floor] : tableOnDisk().floors)
        EXPECT_EQ(rooms.count(room), 1U) << room << " on floor " << floor << " is gone";
}

// The check itself can fail.

const char* const kSmallTable = "0 low util/Low # a comment\n"
                                "\n"
                                "1 middle io/Middle\n"
                                "2 high\n"
                                "only poll.h util/Poll net/\n"
                                "only openssl/ security/\n";

std::vector<std::string> violationsIn(const std::string& room, const std::string& source)
{
    return violations(parseTable(std::string(kSmallTable) + "3 util/Poll net/Socket security/Key\n"), room, source);
}

TEST(IncludeFloorsCheck, AllowsItsOwnFloorAndThoseBelow)
{
    EXPECT_THAT(violationsIn("middle", "#include <qel/common/low.hpp>\n#include <qel/common/util/Low.hpp>\n"
                                       "#include <qel/common/io/Middle.hpp>\n#include <qel/common/middle.hpp>\n"
                                       "#include \"low.hpp\"\n#include <vector>\n"),
                IsEmpty());
}

TEST(IncludeFloorsCheck, FindsAnIncludeThatClimbs)
{
    EXPECT_THAT(violationsIn("middle", "#include <qel/common/high.hpp>\n"),
                ElementsAre("middle (floor 1) includes high.hpp (floor 2)"));
    EXPECT_THAT(violationsIn("util/Low", "  #  include <qel/common/io/Middle.hpp> // why not\n"),
                ElementsAre("util/Low (floor 0) includes io/Middle.hpp (floor 1)"));
    EXPECT_THAT(violationsIn("low", "int a;\n#include \"io/Middle.hpp\"\n"),
                ElementsAre("low (floor 0) includes io/Middle.hpp (floor 1)"));
}

TEST(IncludeFloorsCheck, FindsAFileThatStandsOnNoFloor)
{
    EXPECT_THAT(violationsIn("stray", ""), ElementsAre("stray is not on any floor"));
    EXPECT_THAT(violationsIn("high", "#include <qel/common/stray.hpp>\n#include \"support/Fake.hpp\"\n"),
                ElementsAre("high includes stray.hpp, which is not on any floor",
                            "high includes support/Fake.hpp, which is not on any floor"));
}

TEST(IncludeFloorsCheck, FindsASystemHeaderOutsideItsRooms)
{
    EXPECT_THAT(violationsIn("high", "#include <poll.h>\n#include <openssl/ssl.h>\n"),
                ElementsAre("high includes <poll.h>, which is wrapped elsewhere",
                            "high includes <openssl/ssl.h>, which is wrapped elsewhere"));
    EXPECT_THAT(violationsIn("net/Socket", "#include <poll.h>\n"), IsEmpty());
    EXPECT_THAT(violationsIn("util/Poll", "#include <poll.h>\n"), IsEmpty());
    EXPECT_THAT(violationsIn("security/Key", "#include <openssl/evp.h>\n"), IsEmpty());
}

TEST(IncludeFloorsCheck, RefusesATableThatContradictsItself)
{
    EXPECT_THAT([] { parseTable("0 twice\n1 twice\n"); },
                ThrowsMessage<std::runtime_error>(HasSubstr("is listed twice: twice")));
    EXPECT_THAT([] { parseTable("only poll.h\n"); }, ThrowsMessage<std::runtime_error>(HasSubstr("a room are needed")));
    EXPECT_THROW(parseTable("ground low\n"), std::invalid_argument);
}

// The rooms of the program and of the protocol library are their folders. What each may include besides itself is in
// docs/architecture.md, in the rows of a table:  | `client/` | what is in it | `base`, `transport` |

using Rooms = std::map<std::string, std::set<std::string>>;

/// The words between backticks.
std::vector<std::string> quotedWords(const std::string& text)
{
    std::vector<std::string> words;
    std::istringstream parts(text);
    bool isQuoted = false;
    for (std::string part; std::getline(parts, part, '`'); isQuoted = !isQuoted)
        if (isQuoted) words.push_back(part);
    return words;
}

Rooms parseRooms(std::istream& document, const std::string& heading)
{
    Rooms rooms;
    bool isTable = false;
    for (std::string line; std::getline(document, line);) {
        if (startsWith(line, "## ")) isTable = line == heading;
        if (!isTable || !startsWith(line, "| `")) continue;
        const std::string name = quotedWords(line).front();
        if (name.back() != '/') continue; // the head of the table
        const std::size_t end = line.rfind('|');
        const std::vector<std::string> allowed = quotedWords(line.substr(line.rfind('|', end - 1), end));
        rooms[name.substr(0, name.size() - 1)] = std::set<std::string>(allowed.begin(), allowed.end());
    }
    return rooms;
}

/// A part of the project with rooms.
struct House {
    const char* root;    ///< its folder
    const char* heading; ///< of its table
};

constexpr House kProgram{"/tools/qel", "## The program's rooms"};
constexpr House kLibrary{"/protocol", "## The rooms of the protocol library"};

Rooms roomsOf(const House& house)
{
    std::ifstream document(QEL_SOURCE_DIR "/docs/architecture.md");
    if (!document) throw std::runtime_error("architecture.md cannot be read");
    return parseRooms(document, house.heading);
}

TEST(ProgramRooms, AreReadFromTheirTableAlone)
{
    std::istringstream document("| `other/` | of another table | `low` |\n"
                                "## The program's rooms\n"
                                "| Folder of `tools/qel/` | What is in it | May include |\n|---|---|---|\n"
                                "| `low/` | texts; `qel low` | |\n"
                                "| `high/` | the rest | `low`, `middle` |\n"
                                "## The next\n"
                                "| `later/` | of a later table | |\n");
    EXPECT_EQ(parseRooms(document, kProgram.heading), (Rooms{{"low", {}}, {"high", {"low", "middle"}}}));
}

std::vector<std::string> roomViolations(const Rooms& rooms, const std::string& room, const std::string& source)
{
    std::vector<std::string> result;
    for (const Include& include : includesOf(source)) {
        const std::string other = include.name.substr(0, include.name.find('/'));
        if (other == room || rooms.count(other) == 0) continue; // its own, or none of this house
        if (rooms.at(room).count(other) == 0) result.push_back(room + " includes " + include.name);
    }
    return result;
}

void expectRoomsKept(const House& house)
{
    const Rooms rooms = roomsOf(house);
    std::map<std::string, unsigned> files;
    const std::filesystem::path root = std::string(QEL_SOURCE_DIR) + house.root;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(root)) {
        const std::filesystem::path name = entry.path().lexically_relative(root);
        const bool isSource = name.extension() == ".hpp" || name.extension() == ".cpp";
        if (!isSource || !name.has_parent_path()) continue; // what is in no room knows every room
        const std::string room = name.begin()->string();
        ASSERT_EQ(rooms.count(room), 1U) << name << " is not in any room";
        ++files[room];
        std::ifstream stream(entry.path());
        std::ostringstream text;
        text << stream.rdbuf();
        EXPECT_THAT(roomViolations(rooms, room, text.str()), IsEmpty()) << name;
    }
    ASSERT_FALSE(files.empty());
    for (const auto& [room, allowed] : rooms) {
        EXPECT_GT(files[room], 1U) << room;
        for (const std::string& other : allowed)
            EXPECT_EQ(rooms.count(other), 1U) << other << " is not a room";
    }
}

TEST(ProgramRooms, NoFileOfTheProgramIncludesARoomThatItsOwnMayNot) { expectRoomsKept(kProgram); }

TEST(ProtocolRooms, NoFileOfTheProtocolLibraryIncludesARoomThatItsOwnMayNot) { expectRoomsKept(kLibrary); }

TEST(ProgramRooms, ARoomThatMayNotBeIncludedIsFound)
{
    const Rooms rooms = roomsOf(kProgram);
    EXPECT_THAT(roomViolations(rooms, "serve",
                               "#include \"base/Text.hpp\"\n#include \"client/ConnectOptions.hpp\"\n"
                               "#include \"serve/Server.hpp\"\n#include <qel/common/net/Socket.hpp>\n"),
                ElementsAre("serve includes client/ConnectOptions.hpp"));
    EXPECT_THAT(roomViolations(rooms, "base", "#include \"transport/TransportOptions.hpp\"\n"),
                ElementsAre("base includes transport/TransportOptions.hpp"));
}

} // namespace
