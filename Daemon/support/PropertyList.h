#pragma once
// Property lists (libplist): conversion to and from Value, binary encoding,
// and the dictionary file operations the daemon's state files use.
//
// Type mapping:
//   unsigned integer <-> UInt64, signed integer <-> Int64 (negative values;
//   non-negative integers read back as UInt64), real <-> Real, boolean <->
//   Bool, string <-> String, data <-> Data, date <-> Date (microseconds;
//   written dates must lie within about 68 years of 2001, the range libplist
//   2.2 can hold), array <-> Array, dictionary <-> Dictionary.
//   UUID has no property-list type: it is written as its canonical string and
//   reads back as a String.
//   Read only: a dictionary key node reads as a String. A keyed-archive UID
//   is refused: it only means something inside an archive.
//   Not writable: None, strings or keys holding NUL characters.
//
// Binary lists encode integers above INT64_MAX as 128-bit unsigned ones and
// negative ones as 64-bit signed ones, so both round-trip.

#include "Daemon/support/QRNError.h"
#include "Daemon/support/Value.h"

#include <plist/plist.h>

#include <cstdint>
#include <filesystem>
#include <memory>
#include <span>
#include <string_view>
#include <vector>

namespace quarn {

// General-domain codes of property-list reading and writing.
inline constexpr std::int64_t kGeneralErrorPropertyListReadCorrupt = 3840;
inline constexpr std::int64_t kGeneralErrorPropertyListWriteInvalid = 3852;

// Files larger than this are refused (EFBIG) rather than read into memory.
inline constexpr std::size_t kMaxPropertyListFileSize = 16u << 20;

struct PropertyListDeleter {
    void operator()(plist_t node) const { plist_free(node); }
};
using PropertyListPtr = std::unique_ptr<void, PropertyListDeleter>;

Result<PropertyListPtr> propertyListFromValue(const Value& value);
Result<Value> valueFromPropertyList(plist_t node);
// The checks `valueFromPropertyList` makes, without building the Value: for
// readers that keep only a few members of a large tree.
Status checkPropertyList(plist_t node);

// XML or binary. A pure function of the bytes; hostile input gives an error.
Result<Value> valueFromPropertyListBytes(std::span<const std::uint8_t> bytes);
// The bytes parsed by libplist once they have passed the hostile-input
// checks; the tree is not yet checked as `checkPropertyList` does.
Result<PropertyListPtr> propertyListFromBytes(std::span<const std::uint8_t> bytes);
Result<std::vector<std::uint8_t>> binaryPropertyList(const Value& value);

struct WriteOptions {
    // Write a temporary file in the same directory and rename it over the
    // destination, so readers see the old or the new file, never a mix.
    bool atomic = false;
    // Give the file the lowest data protection class, so it stays readable
    // whatever the device's lock state.
    bool lowestProtection = false;
    // Flush the file before it replaces the destination, and the directory
    // after (intent records that must survive a crash).
    bool fsync = false;
};

// Writes `dictionary` (which must be one) as a binary property list.
Status QRN_writeToURL(const Value& dictionary, const std::filesystem::path& url,
                      WriteOptions options = {});

// Reads a property list (XML or binary) from a file, without caching. The
// final path component must not be a symbolic link (ELOOP). A top-level
// object that is not a dictionary fails with kGeneralErrorFileReadCorrupt.
Result<Value> QRN_dictionaryWithContentsOfURL(const std::filesystem::path& url);
// The same file, checks and errors, kept as libplist's tree: a reader that
// looks at a few keys need not build a Value of the whole file. The path is
// taken as a string, so a reader of many files builds no path objects.
Result<PropertyListPtr> QRN_dictionaryNodeWithContentsOfFile(const std::string& path);

// True when a component of `path` is exactly "..".
bool containsDotDotPathComponents(std::string_view path);

} // namespace quarn
