// Small string helpers shared by the storage classes.
//
// dbqueries::quoted writes a table name into SQL, dbqueries::concat joins
// the pieces of a statement's text; stringReplace fills the
// place-holders of caller-supplied SQL; stringToLongLong reads numbers kept
// as text. All are pure functions: safe from any thread, and they throw
// nothing but std::bad_alloc.
#pragma once

#include <initializer_list>
#include <string>
#include <string_view>

namespace lumivale {
namespace tessarine {

namespace dbqueries {

// The name enclosed in double quotes, unchanged inside: nothing is escaped or
// doubled. Only names made of letters, digits, underscores and colons (the
// per-collection table names) are meant to go through it.
std::string quoted(const std::string& name);

// The parts one after another, built with a single allocation: SQL texts are
// made on every operation, so their building should cost next to nothing.
std::string concat(std::initializer_list<std::string_view> parts);

}  // namespace dbqueries

// Every occurrence of pattern in text replaced by replacement, left to right
// and without overlap; text that came from a replacement is never searched
// again. An empty pattern gives an unchanged copy of text.
std::string stringReplace(const std::string& text, const std::string& pattern, const std::string& replacement);

// The number at the start of text, read as a string stream reads a long long
// in the classic locale: leading white space is skipped, then an optional
// sign and decimal digits are taken up to the first other character; the rest
// is ignored. Text holding no number (empty, only white space, or starting
// with any other character) gives 0. A number beyond the range of long long
// gives the nearest limit (LLONG_MAX or LLONG_MIN).
long long stringToLongLong(const std::string& text);

}  // namespace tessarine
}  // namespace lumivale
