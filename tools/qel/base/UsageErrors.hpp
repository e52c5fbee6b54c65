#pragma once

#include <CLI/CLI.hpp>
#include <string>
#include <vector>

namespace qel::tool {

/// Says in one line what is wrong with a command line, without the leading "qel: ".
///
/// An unknown word comes first, because it causes the other errors: it is named together with the nearest word that
/// would have been known. Otherwise it is what the parser found.
/// @param app  the top-level app, after the parse() that threw
/// @param error  what it threw; not a request for help or the version
std::string usageMessage(const CLI::App& app, const CLI::ParseError& error);

/// The candidate that an unknown word most likely stands for. @return empty: none is near
std::string nearestWord(const std::string& word, const std::vector<std::string>& candidates);

/// The number of letters to insert, delete, replace, or swap with their neighbour to turn one word into the other.
std::size_t editDistance(const std::string& left, const std::string& right);

} // namespace qel::tool
