#pragma once
// Error codes of the "QRNErrorDomain" and the error value every operation
// reports through. Making an Error writes it to the log once.

#include "Daemon/support/Expected.h"
#include "Daemon/support/Log.h"

#include <fmt/format.h>

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

namespace quarn {

// Numbers are part of the protocol: clients see them as "ReplyError".
enum QRNErrorCode : std::uint64_t {
    kQRNErrorNone = 1,
    kQRNErrorMoveDirFailed = 4,
    kQRNErrorRemoveTransientFailed = 5,
    kQRNErrorCreateDirFailed = 6,
    kQRNErrorCreateStagingFailed = 7,
    kQRNErrorMoveStagingToLiveFailed = 8,
    kQRNErrorRemoveStagingFailed = 9,
    kQRNErrorInvalidPath = 10,
    kQRNErrorInvalidArgument = 11,
    kQRNErrorReadPlistFailed = 12,
    kQRNErrorMoveOldToStagingFailed = 14,
    kQRNErrorReplaceFailed = 15,
    kQRNErrorDestroyFailed = 17,
    kQRNErrorMissingIdentifier = 18,
    kQRNErrorUnexpectedContainerType = 20,
    kQRNErrorContainerNotFound = 21,
    kQRNErrorReplaceSameContainer = 22,
    kQRNErrorReplaceDifferentClasses = 23,
    kQRNErrorInfoValueNotFound = 24,
    kQRNErrorContainerExists = 27,
    kQRNErrorDeleteContainerFailed = 28,
    kQRNErrorInvalidMetadata = 29,
    kQRNErrorInvalidReplaceFileInfo = 33,
    kQRNErrorWriteStateFileFailed = 34,
    kQRNErrorReadReplaceFileFailed = 35,
    kQRNErrorRemoveStateFileFailed = 36,
    kQRNErrorBadRequestArgument = 38,
    kQRNErrorException = 40,
    kQRNErrorMoveItemFailed = 41,
    kQRNErrorCacheRebuildFailed = 43,
    kQRNErrorNoMetadata = 44,
    kQRNErrorCacheAddFailed = 45,
    kQRNErrorCacheRemoveFailed = 46,
    kQRNErrorInvalidCacheInput = 47,
    kQRNErrorMoveToNewUUIDFailed = 48,
    kQRNErrorInvalidCommand = 49,
    kQRNErrorNotEntitled = 55,
    kQRNErrorMismatchedInputLists = 60,
    kQRNErrorProtectionSkippedWhileLocked = 61,
    kQRNErrorChangeOwnerFailed = 62,
    kQRNErrorSetACLFailed = 63,
    kQRNErrorMigrationMoveFailed = 64,
    kQRNErrorDatabaseFailed = 66,
    kQRNErrorDatabaseRowNotFound = 67,
    kQRNErrorDatabaseUnexpectedChanges = 68,
    kQRNErrorOperationSuperseded = 69,
    kQRNErrorUserManagedPathNotFound = 71,
    kQRNErrorDatabaseAllocationFailed = 73,
    kQRNErrorInvalidUserIdentityPlist = 75,
    kQRNErrorReplaceDifferentPersonas = 76,
};

// A short symbolic name ("ContainerNotFound") for a code, or "Unknown".
const char* QRNErrorCodeName(std::uint64_t code);

// The general domain's "file read corrupt" code, used when a property-list
// file does not hold a dictionary.
inline constexpr std::int64_t kGeneralErrorFileReadCorrupt = 2048;

struct Error {
    enum class Domain { QRN, POSIX, General };

    Domain domain = Domain::QRN;
    std::int64_t code = 0;
    std::string message;  // the localized description
    std::string function; // "FunctionName"
    int line = 0;         // "SourceFileLine"
    std::shared_ptr<const Error> underlying;

    static const char* domainName(Domain d);
    const char* domainName() const { return domainName(domain); }
    bool isPOSIX(int err) const { return domain == Domain::POSIX && code == err; }
    bool isQRN(std::uint64_t c) const {
        return domain == Domain::QRN && code == static_cast<std::int64_t>(c);
    }
    // The code as the request layer reports it: QRN codes as they are,
    // anything else as `fallback`.
    std::uint64_t qrnCode(std::uint64_t fallback) const {
        return domain == Domain::QRN ? static_cast<std::uint64_t>(code) : fallback;
    }
    std::string description() const;

    // Builds the error and writes "%d: %@ (%@)" / "%d: %@" at error level.
    static Error make(Domain domain, std::int64_t code, std::string message,
                      std::string_view prettyFunction, int line,
                      std::shared_ptr<const Error> underlying = nullptr);
};

template <class T> using Result = Expected<T, Error>;
using Status = Expected<void, Error>;
// For operations that report a bare QRNErrorDomain code (never 1 on failure).
template <class T> using CodeResult = Expected<T, std::uint64_t>;
#define QRN_CODE(code) ::quarn::Unexpected<std::uint64_t>(static_cast<std::uint64_t>(code))

// "quarn::QRNFileManager::removeItemAtURL" from a __PRETTY_FUNCTION__.
std::string qualifiedFunctionName(std::string_view prettyFunction);

} // namespace quarn

// Construction helpers: the message is formatted with fmt, the function name
// and line come from the call site.
#define QRN_ERROR(code, ...)                                                                       \
    ::quarn::Error::make(::quarn::Error::Domain::QRN, static_cast<std::int64_t>(code),             \
                         fmt::format(__VA_ARGS__), __PRETTY_FUNCTION__, __LINE__)
#define QRN_ERROR_UNDERLYING(underlyingError, code, ...)                                           \
    ::quarn::Error::make(::quarn::Error::Domain::QRN, static_cast<std::int64_t>(code),             \
                         fmt::format(__VA_ARGS__), __PRETTY_FUNCTION__, __LINE__,                  \
                         std::make_shared<const ::quarn::Error>(underlyingError))
#define QRN_POSIX_ERROR(err, ...)                                                                  \
    ::quarn::Error::make(::quarn::Error::Domain::POSIX, static_cast<std::int64_t>(err),            \
                         fmt::format(__VA_ARGS__), __PRETTY_FUNCTION__, __LINE__)
#define QRN_UNEXPECTED(error) ::quarn::Unexpected<::quarn::Error>(error)
