#include "Daemon/support/QRNError.h"

namespace quarn {

const char* QRNErrorCodeName(std::uint64_t code) {
    switch (code) {
#define QRN_NAME(c, n)                                                                             \
    case c:                                                                                        \
        return n;
        QRN_NAME(kQRNErrorNone, "Success")
        QRN_NAME(kQRNErrorMoveDirFailed, "MoveDirFailed")
        QRN_NAME(kQRNErrorRemoveTransientFailed, "RemoveTransientFailed")
        QRN_NAME(kQRNErrorCreateDirFailed, "CreateDirFailed")
        QRN_NAME(kQRNErrorCreateStagingFailed, "CreateStagingFailed")
        QRN_NAME(kQRNErrorMoveStagingToLiveFailed, "MoveStagingToLiveFailed")
        QRN_NAME(kQRNErrorRemoveStagingFailed, "RemoveStagingFailed")
        QRN_NAME(kQRNErrorInvalidPath, "InvalidPath")
        QRN_NAME(kQRNErrorInvalidArgument, "InvalidArgument")
        QRN_NAME(kQRNErrorReadPlistFailed, "ReadPlistFailed")
        QRN_NAME(kQRNErrorMoveOldToStagingFailed, "MoveOldToStagingFailed")
        QRN_NAME(kQRNErrorReplaceFailed, "ReplaceFailed")
        QRN_NAME(kQRNErrorDestroyFailed, "DestroyFailed")
        QRN_NAME(kQRNErrorMissingIdentifier, "MissingIdentifier")
        QRN_NAME(kQRNErrorUnexpectedContainerType, "UnexpectedContainerType")
        QRN_NAME(kQRNErrorContainerNotFound, "ContainerNotFound")
        QRN_NAME(kQRNErrorReplaceSameContainer, "ReplaceSameContainer")
        QRN_NAME(kQRNErrorReplaceDifferentClasses, "ReplaceDifferentClasses")
        QRN_NAME(kQRNErrorInfoValueNotFound, "InfoValueNotFound")
        QRN_NAME(kQRNErrorContainerExists, "ContainerExists")
        QRN_NAME(kQRNErrorDeleteContainerFailed, "DeleteContainerFailed")
        QRN_NAME(kQRNErrorInvalidMetadata, "InvalidMetadata")
        QRN_NAME(kQRNErrorInvalidReplaceFileInfo, "InvalidReplaceFileInfo")
        QRN_NAME(kQRNErrorWriteStateFileFailed, "WriteStateFileFailed")
        QRN_NAME(kQRNErrorReadReplaceFileFailed, "ReadReplaceFileFailed")
        QRN_NAME(kQRNErrorRemoveStateFileFailed, "RemoveStateFileFailed")
        QRN_NAME(kQRNErrorBadRequestArgument, "BadRequestArgument")
        QRN_NAME(kQRNErrorException, "Exception")
        QRN_NAME(kQRNErrorMoveItemFailed, "MoveItemFailed")
        QRN_NAME(kQRNErrorCacheRebuildFailed, "CacheRebuildFailed")
        QRN_NAME(kQRNErrorNoMetadata, "NoMetadata")
        QRN_NAME(kQRNErrorCacheAddFailed, "CacheAddFailed")
        QRN_NAME(kQRNErrorCacheRemoveFailed, "CacheRemoveFailed")
        QRN_NAME(kQRNErrorInvalidCacheInput, "InvalidCacheInput")
        QRN_NAME(kQRNErrorMoveToNewUUIDFailed, "MoveToNewUUIDFailed")
        QRN_NAME(kQRNErrorInvalidCommand, "InvalidCommand")
        QRN_NAME(kQRNErrorNotEntitled, "NotEntitled")
        QRN_NAME(kQRNErrorMismatchedInputLists, "MismatchedInputLists")
        QRN_NAME(kQRNErrorProtectionSkippedWhileLocked, "ProtectionSkippedWhileLocked")
        QRN_NAME(kQRNErrorChangeOwnerFailed, "ChangeOwnerFailed")
        QRN_NAME(kQRNErrorSetACLFailed, "SetACLFailed")
        QRN_NAME(kQRNErrorMigrationMoveFailed, "MigrationMoveFailed")
        QRN_NAME(kQRNErrorDatabaseFailed, "DatabaseFailed")
        QRN_NAME(kQRNErrorDatabaseRowNotFound, "DatabaseRowNotFound")
        QRN_NAME(kQRNErrorDatabaseUnexpectedChanges, "DatabaseUnexpectedChanges")
        QRN_NAME(kQRNErrorOperationSuperseded, "OperationSuperseded")
        QRN_NAME(kQRNErrorUserManagedPathNotFound, "UserManagedPathNotFound")
        QRN_NAME(kQRNErrorDatabaseAllocationFailed, "DatabaseAllocationFailed")
        QRN_NAME(kQRNErrorInvalidUserIdentityPlist, "InvalidUserIdentityPlist")
        QRN_NAME(kQRNErrorReplaceDifferentPersonas, "ReplaceDifferentPersonas")
#undef QRN_NAME
    default:
        return "Unknown";
    }
}

const char* Error::domainName(Domain d) {
    switch (d) {
    case Domain::QRN:
        return "QRNErrorDomain";
    case Domain::POSIX:
        return "NSPOSIXErrorDomain";
    case Domain::General:
        return "NSCocoaErrorDomain";
    }
    return "";
}

std::string Error::description() const {
    std::string d =
        fmt::format("Error Domain={} Code={} \"{}\" {{FunctionName={}, SourceFileLine={}",
                    domainName(), code, message, function, line);
    if (underlying) {
        d += ", NSUnderlyingError=" + underlying->description();
    }
    d += "}";
    return d;
}

std::string qualifiedFunctionName(std::string_view pretty) {
    // Drop the parameter list, then the return type (the last space at
    // template depth 0 before the name).
    auto paren = pretty.find('(');
    std::string_view head = pretty.substr(0, paren);
    int depth = 0;
    std::size_t start = 0;
    for (std::size_t i = 0; i < head.size(); ++i) {
        char c = head[i];
        if (c == '<') {
            ++depth;
        } else if (c == '>') {
            --depth;
        } else if (c == ' ' && depth == 0) {
            start = i + 1;
        }
    }
    return std::string(head.substr(start));
}

Error Error::make(Domain domain, std::int64_t code, std::string message,
                  std::string_view prettyFunction, int line,
                  std::shared_ptr<const Error> underlying) {
    Error e;
    e.domain = domain;
    e.code = code;
    e.message = std::move(message);
    e.function = qualifiedFunctionName(prettyFunction);
    e.line = line;
    e.underlying = std::move(underlying);
    auto& logger = Log::logger(LogCategory::Unspecified);
    spdlog::source_loc where{"", line, e.function.c_str()};
    if (e.underlying) {
        logger.log(where, spdlog::level::err, "{}: {} ({})", line, e.message,
                   e.underlying->description());
    } else {
        logger.log(where, spdlog::level::err, "{}: {}", line, e.message);
    }
    return e;
}

} // namespace quarn
