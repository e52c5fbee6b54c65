#include "proxy/FrameNames.hpp"

#include <qel/common/QelMessageIdentifiers.hpp>
#include <qel/common/StreamFormatters.hpp>

#include <map>

namespace qel::tool {

namespace {

/// The name in "0x6003 (QelMessageFunctionQelInterfaceCmp)" without its prefix; empty when there is none.
template <typename T>
std::string nameIn(const T& value, const std::string& prefix)
{
    const std::string text = toString(value);
    const std::size_t begin = text.find("(" + prefix);
    if (begin == std::string::npos) return {};
    const std::size_t name = begin + 1 + prefix.size();
    return text.substr(name, text.rfind(')') - name);
}

/// The numbers that may have a name; the library has the names.
constexpr QelMessageFunctionCodes kFunctions[] = {
    QelMessageFunctionQel,           QelMessageFunctionVirtualSerial, QelMessageFunctionQelInterfaceCmp,
    QelMessageFunctionDax,           QelMessageFunctionKrogCmdRouter, QelMessageFunctionKrogLparConfig,
    QelMessageFunctionKrogLparDlpar, QelMessageFunctionKrogVsp,       QelMessageFunctionKrogRellAp,
    QelMessageFunctionKrogConcMaint, QelMessageFunctionKrogPerfCmd,   QelMessageFunctionKrogMigration,
    QelMessageFunctionKrogHypePipe,  QelMessageFunctionKrogNvRam,     QelMessageFunctionQelKrog,
};

/// Operations are in these ranges: [first, last].
constexpr std::pair<std::uint16_t, std::uint16_t> kOperations[] = {
    {0x0001, 0x000F}, {0x0101, 0x010F}, {0x0401, 0x040F}, {0x0B00, 0x0B0F}, {0x8101, 0x810F}, {0xA000, 0xA00F},
};

std::vector<std::pair<std::uint16_t, std::string>> makeFunctions()
{
    std::vector<std::pair<std::uint16_t, std::string>> functions;
    for (const QelMessageFunctionCodes function : kFunctions)
        functions.emplace_back(function, nameIn(function, "QelMessageFunction"));
    return functions;
}

std::vector<NamedOperation> makeOperations()
{
    std::vector<NamedOperation> operations;
    for (const QelMessageFunctionCodes function : kFunctions) {
        for (const auto& range : kOperations) {
            for (unsigned int number = range.first; number <= range.second; ++number) {
                const auto operation = static_cast<QelMessageOpTypes>(number);
                std::string name = nameIn(std::make_pair(function, operation), "QelMessageOp");
                if (!name.empty()) operations.push_back({function, operation, std::move(name)});
            }
        }
    }
    return operations;
}

const std::string kNoName;

template <typename Key>
const std::string& find(const std::map<Key, std::string>& names, const Key& key)
{
    const auto found = names.find(key);
    return found == names.end() ? kNoName : found->second;
}

} // namespace

const std::vector<std::pair<std::uint16_t, std::string>>& namedFunctions()
{
    static const std::vector<std::pair<std::uint16_t, std::string>> functions = makeFunctions();
    return functions;
}

const std::vector<NamedOperation>& namedOperations()
{
    static const std::vector<NamedOperation> operations = makeOperations();
    return operations;
}

const std::string& operationName(std::uint16_t function, std::uint16_t operation)
{
    using Key = std::pair<std::uint16_t, std::uint16_t>;
    static const std::map<Key, std::string> names = [] {
        std::map<Key, std::string> all;
        for (const NamedOperation& one : namedOperations())
            all.emplace(Key(one.function, one.operation), one.name);
        return all;
    }();
    return find(names, Key(function, operation));
}

const std::string& shortStatusName(std::uint16_t status)
{
    static const std::map<std::uint16_t, std::string> names = [] {
        std::map<std::uint16_t, std::string> all;
        const auto add = [&all](unsigned int number) {
            std::string name = nameIn(static_cast<QelMessageStatusCodes>(number), "QelMessageStatus");
            if (!name.empty()) all.emplace(static_cast<std::uint16_t>(number), std::move(name));
        };
        constexpr unsigned int kUsual = 256;
        for (unsigned int number = 0; number < kUsual; ++number)
            add(number);
        add(QelMessageStatusHypervisorGenericError);
        return all;
    }();
    return find(names, status);
}

} // namespace qel::tool
