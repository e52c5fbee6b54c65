#pragma once

#include <qel/common/QelExport.hpp>

#include <string>
#include <type_traits>
#include <vector>

/// Functions on strings, paths and whole files.
/// Thread safety: every function may be called from any thread.
/// Each function that returns a string or a vector may throw std::bad_alloc; other exceptions are named at the
/// function.
namespace qel::Utilities {

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
/// @param limit the maximum number of splits; the rest, separators included, is the last piece. 0 splits nothing, a
///              negative limit means no limit
/// @return at least one piece; the empty text gives one empty piece
QEL_EXPORT std::vector<std::string> split(const std::string& text, char separator, long limit = -1);

// <libgen.h> makes basename a macro for __xpg_basename. With the macro suspended here and a function of that name
// beside the real one, Utilities::basename works whether <libgen.h> comes before this header, after it or not at all.
#pragma push_macro("basename")
#undef basename

/// @return the last component of a path; separators at the end of the path are ignored: "a/b/" gives "b", "a" gives
/// "a"; a path that consists of separators gives "/", the empty path gives "."
QEL_EXPORT std::string basename(const std::string& path);

/// What basename() is called in a source file that includes <libgen.h>; do not write this name.
inline std::string __xpg_basename(const std::string& path) // NOLINT(bugprone-reserved-identifier): see above
{
    return basename(path);
}

#pragma pop_macro("basename")

/// @return the part of a path before its last component, without the separators between the two; separators at the end
/// of the path are ignored: "a//b" and "a/b/" give "a", "/a" gives "/"; a path without a separator and the empty path
/// give "."; a path that consists of separators gives "/"
QEL_EXPORT std::string dirname(const std::string& path);

/// @return the absolute path of an existing file or directory, with links, "." and ".." resolved; see realpath(3)
/// @throws PosixError (not FileIOError: nothing is read or written) with the context "Failed to normalize path " + path
QEL_EXPORT std::string normalizePath(const std::string& path);

/// Reads a whole file, without any conversion.
/// @return the content; empty for an empty file, and for a directory, which can be opened but not read
/// @throws FileIOError with the context "Failed to read contents of file " + path: the file cannot be opened, or a read
///         fails. A part of a file is never returned.
QEL_EXPORT std::string readFile(const std::string& path);

/// Writes a whole file: creates it when it is missing and replaces what it held. All bytes have been handed to the
/// system when this returns; they have not been forced to the disk.
/// @throws FileIOError with the context "Failed to write contents of file " + path; the file may then hold a part
QEL_EXPORT void writeFile(const std::string& path, const std::string& content);

/// Reads a truth value. Upper and lower case are the same; "y", "yes", "true" and "1" are true, "n", "no", "false" and
/// "0" are false.
/// @throws std::invalid_argument with the text, as it was given, + " is not convertible to bool"
QEL_EXPORT bool parseBool(const std::string& text);

/// Passes a temporary on as an lvalue, so that a temporary stream can be written to in one expression:
/// `Utilities::ref(QelDebugContext(logger, level)) << ...`. Always write the namespace: a plain `ref` finds the
/// standard library's function of that name, which refuses temporaries.
/// @return the argument itself; a temporary still ends with the full expression
template <typename T>
typename std::remove_reference<T>::type& ref(T&& temporary) noexcept
{
    return temporary;
}

} // namespace qel::Utilities
