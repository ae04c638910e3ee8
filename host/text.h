// Text for terminals: foreign names made harmless, and measured in columns.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace appsync {

// The text on one line, as UTF-8, with nothing in it that a terminal would obey: control characters, escape sequences,
// marks that turn the direction of writing and bytes that are no UTF-8 become "�".
std::string printable(std::string_view text);

// Columns that a printable text takes: 2 for wide characters, 0 for combining ones.
std::size_t displayWidth(std::string_view text);

// The text in exactly `columns` columns: filled up with blanks, or cut off with "…".
std::string fitted(std::string_view text, std::size_t columns);

// "1 file", "2 files".
std::string counted(std::size_t number, std::string_view one, std::string_view many);

// "712 B", "4.2 MiB".
std::string byteText(double bytes);

// The registry's install type with its name: "restore (2)"; a number without a name by itself.
std::string installTypeText(std::uint64_t type);

}  // namespace appsync
