#pragma once

#include <qel/common/QelExport.hpp>

#include <string>
#include <type_traits>
#include <vector>

namespace qel {

/// Functions on strings, paths and whole files.
/// Thread safety: every function may be called from any thread. Functions on strings throw std::bad_alloc only, unless
/// they say more.
namespace Utilities {

/// @return the text with each byte through the C library's tolower(3), that is by the process's C locale
QEL_EXPORT std::string lowercase(const std::string& text);

/// @return the text with each byte through the C library's toupper(3), that is by the process's C locale
QEL_EXPORT std::string uppercase(const std::string& text);

/// Removes characters from the end of a text.
/// @param chars zero-terminated set of the characters to remove, in any order
/// @return the text up to its last character outside the set; empty when there is none
QEL_EXPORT std::string rstrip(const std::string& text, const char* chars);

/// Removes characters from both ends of a text.
/// @param chars zero-terminated set of the characters to remove, in any order
QEL_EXPORT std::string strip(const std::string& text, const char* chars);

/// Splits a text at a separator, from the left. Empty pieces are kept.
/// @param limit at most so many splits are made, and what is left, separators included, is the last piece; 0 splits
///              nothing, and a negative limit means no limit
/// @return at least one piece; the empty text gives one empty piece
QEL_EXPORT std::vector<std::string> split(const std::string& text, char separator, long limit = -1);

/// @return the last component of a path, separators at its end ignored: "a/b/" gives "b", "a" gives "a"; a path of
/// separators only gives "/", the empty path gives "."
QEL_EXPORT std::string basename(const std::string& path);

/// @return what stands before the last component of a path, without the separators between them and ignoring those at
/// the end: "a//b" and "a/b/" give "a", "/a" gives "/"; a path without a separator gives ".", the empty one too; a path
/// of separators only gives "/"
QEL_EXPORT std::string dirname(const std::string& path);

/// @return the absolute path of an existing file or directory, with links, "." and ".." resolved; see realpath(3)
/// @throws PosixError (not FileIOError: nothing is read or written) with the context "Failed to normalize path <path>"
QEL_EXPORT std::string normalizePath(const std::string& path);

/// Reads a whole file, byte by byte as it is.
/// @return the content; empty for an empty file, and for a directory, which opens but cannot be read
/// @throws FileIOError with the context "Failed to read contents of file <path>"
QEL_EXPORT std::string readFile(const std::string& path);

/// Writes a whole file: creates it when it is missing and replaces what it held. All bytes have been handed to the
/// system when this returns; they have not been forced to the disk.
/// @throws FileIOError with the context "Failed to write contents of file <path>"; the file may hold a part by then
QEL_EXPORT void writeFile(const std::string& path, const std::string& content);

/// Reads a truth value. In any mixture of upper and lower case, "y", "yes", "true" and "1" are true, "n", "no", "false"
/// and "0" are false.
/// @throws std::invalid_argument "<text> is not convertible to bool", with the text as it was given
QEL_EXPORT bool parseBool(const std::string& text);

/// Gives a temporary a name for the length of one expression, so that a temporary stream can be written to:
/// `Utilities::ref(QelDebugContext(logger, level)) << ...`. Always write the namespace: a plain `ref` finds the
/// standard library's function of that name, which refuses temporaries.
/// @return the argument itself; a temporary dies at the end of the full expression as always
template <typename T>
typename std::remove_reference<T>::type& ref(T&& temporary) noexcept
{
    return temporary;
}

} // namespace Utilities

} // namespace qel
