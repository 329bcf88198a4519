#pragma once
// Property lists (XML and binary) through libplist 2.2, read into qm::Value
// and written back.
//
// Mapping, both ways without loss unless said otherwise:
// - integer: libplist keeps one 64-bit integer type and stores a negative
//   number as its two's complement, so every integer reads back as a signed
//   integer and an unsigned one above INT64_MAX reads back negative (a
//   property list never holds such a number in practice). Writing an
//   unsigned integer above INT64_MAX is an error rather than a silent sign flip.
// - real, boolean, string (strict UTF-8, no NUL), data, array, dictionary.
// - date: libplist counts seconds from 2001-01-01 in a double; qm::Date counts
//   from 1970. Any date reads back exactly. Only dates whose whole seconds
//   fit libplist's 32-bit setter (1932-12-13T20:45:52Z to 2069-01-19T03:14:07Z)
//   can be written; others are an error, not clamped, so a written file never
//   says something else than the value did. Binary keeps microseconds, XML
//   whole seconds (libplist's XML form).
// - null, UUID and packed values have no property-list form: writing one is
//   an error (a UUID is not turned into text, which would read back as a
//   string).
// - libplist's UID nodes are refused when read.
//
// Hostile input: files over 64 MiB are refused before reading; nesting deeper
// than 512 containers, binary lists whose shared objects would expand past
// binaryNodeBound() and binary keys with NUL are refused before libplist
// builds anything (it recurses once per level, copies shared objects and
// asserts on such keys). Every function may be called from any thread.

#include <algorithm>
#include <cstdint>
#include <span>
#include <string>

#include "platform/error/Error.h"
#include "platform/value/Value.h"

namespace qm::plist {

enum class Format { xml, binary };

// Errors that are not the operating system's carry this domain.
inline constexpr const char* kErrorDomain = "plist";
enum ErrorCode : int {
    kErrorMalformed = 1,    // not a property list, or a damaged one
    kErrorUnsupported = 2,  // a node or value with no counterpart on the other side
    kErrorTooComplex = 3,   // over the size, nesting or expansion limits
};

inline constexpr std::size_t kMaxBytes = 64u * 1024 * 1024;
inline constexpr unsigned kMaxNesting = 512;
inline constexpr std::uint64_t kMaxBinaryNodes = 4u * 1024 * 1024;

// How many nodes a binary list of this many bytes may expand to. Without
// shared containers every node but the top is one reference of at least one
// byte, so honest lists stay under one node per byte; four per byte (and 64 Ki
// for any list) leaves room, while a few kilobytes of containers referring to
// each other can no longer make a tree of millions of nodes (about 120 bytes
// each once built).
constexpr std::uint64_t binaryNodeBound(std::size_t bytes) {
    constexpr std::uint64_t kNodesPerByte = 4;
    constexpr std::uint64_t kFloor = 64 * 1024;
    return std::min(kMaxBinaryNodes, std::max(kFloor, kNodesPerByte * bytes));
}

// Seconds between 1970-01-01 and 2001-01-01, the reference date of property lists.
inline constexpr double kSecondsFrom1970To2001 = 978307200;

// XML or binary, told apart by the binary header.
qm::Result<qm::Value> parse(std::span<const std::uint8_t> bytes);

// A file's whole content, parsed. Errors: a posix error (domain "posix", the
// errno) when the file cannot be opened or read or is not a regular file
// (EFBIG over the size limit), else a parse error.
qm::Result<qm::Value> readFile(const std::string& path);

// The same from an open descriptor, read from its current offset to its end;
// name is used in error texts only. The descriptor stays open.
qm::Result<qm::Value> readDescriptor(int fd, const std::string& name);

qm::Result<qm::Bytes> serialize(const qm::Value& value, Format format);

// Writes a temporary file beside path, flushes it to disk and renames it over
// path, so readers see the old or the new content, never a mix. A new file
// is private to the user (0600); a replaced file keeps its permission bits.
qm::MaybeError writeFileAtomically(const std::string& path, const qm::Value& value, Format format);

}  // namespace qm::plist
