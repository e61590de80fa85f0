// Error objects and the daemon's error codes.
//
// One numbering serves "ReplyError", error objects and logs. Error objects are immutable
// and shared; they are only made through STWErrorCreate (the STW_ERROR macros), which
// formats the message, records the failing function and line, and logs the error unless
// told not to.
//
// How failure travels. Clients get daemon codes: the request handlers and the
// client-connection operations write them through `uint64_t* error`, as do the model's
// identity constructors, which check what a client sent. Everything below them (the
// container cache, the model, the file layer, the platform services) reports an error
// object through `STWErrorRef* error`, in the domain of whoever decided the failure: a
// daemon code in STWErrorDomain, an errno in STWPOSIXErrorDomain. Only a thin wrapper of a
// system call answers in the call's own form instead (-1 or nullptr with errno set, or the
// errno value itself), one form per module, said in its header. A code is read only in its
// own domain: whoever answers an error of another domain with a daemon code uses the
// operation's own documented code and keeps the error as its underlying error, and an
// errno is taken from an error object only through posixCode().
#pragma once

#include "common/STWFormat.h"

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

inline constexpr std::string_view STWErrorDomain = "STWErrorDomain";
// System calls: the code is the errno of the failing call.
inline constexpr std::string_view STWPOSIXErrorDomain = "STWPOSIXErrorDomain";
// General errors of the platform's own services (a corrupt property list, for one).
inline constexpr std::string_view STWGenericErrorDomain = "STWGenericErrorDomain";

inline constexpr int64_t STWGenericErrorCorruptFile = 2048;

// Result codes of STWErrorDomain. 1 is success; every command reply carries one.
enum STWErrorCode : uint64_t {
    STWErrorSuccess = 1,
    STWErrorMoveDirectoryFailed = 4,
    STWErrorRemoveTransientFailed = 5,
    STWErrorCreateSubdirectoryFailed = 6,
    STWErrorCreateStagingFailed = 7,
    STWErrorMoveStagingFailed = 8,
    STWErrorRemoveStagingFailed = 9,
    STWErrorInvalidPath = 10,
    STWErrorInvalidClass = 11,
    STWErrorReadFileFailed = 12,
    STWErrorMoveToStagingFailed = 14,
    STWErrorReplaceFailed = 15,
    STWErrorDestroyFailed = 17,
    STWErrorNoIdentifier = 18,
    STWErrorUnexpectedClass = 20,
    STWErrorNotFound = 21,
    STWErrorReplaceWithSelf = 22,
    STWErrorReplaceAcrossClasses = 23,
    STWErrorInfoValueNotFound = 24,
    STWErrorAlreadyExists = 27,
    STWErrorDeleteFailed = 28,
    STWErrorInvalidContent = 29,
    STWErrorInvalidReplaceInfo = 33,
    STWErrorWriteFileFailed = 34,
    STWErrorBadReplaceFile = 35,
    STWErrorRemovePendingFileFailed = 36,
    STWErrorInvalidArgument = 38,
    STWErrorException = 40,
    STWErrorItemOperationFailed = 41,
    STWErrorCacheRebuildFailed = 43,
    STWErrorMetadataMissing = 44,
    STWErrorCacheAddFailed = 45,
    STWErrorCacheRemoveFailed = 46,
    STWErrorCacheInvalidInput = 47,
    STWErrorMoveToNewUUIDFailed = 48,
    STWErrorUnsupportedCommand = 49,
    STWErrorNotEntitled = 55,
    STWErrorCountMismatch = 60,
    STWErrorDeviceLocked = 61,
    STWErrorChangeOwnerFailed = 62,
    STWErrorSetACLFailed = 63,
    STWErrorMoveFailed = 64,
    STWErrorDatabase = 66,
    STWErrorIdentifierNotInDatabase = 67,
    STWErrorUnexpectedRowCount = 68,
    STWErrorSuperseded = 69,
    STWErrorUserManagedPathNotFound = 71,
    STWErrorAllocationFailed = 73,
    STWErrorMalformedUserIdentity = 75,
    STWErrorPersonaMismatch = 76,
    STWErrorCommandQueueExhausted = 77,
};

// The constant's name without its prefix ("NotEntitled"), or nullptr for an unknown code.
const char* STWErrorCodeName(uint64_t code);
// What the code tells a client ("not entitled"), or nullptr for an unknown code.
const char* STWErrorCodeMeaning(uint64_t code);

class STWError;
using STWErrorRef = std::shared_ptr<const STWError>;

class STWError {
public:
    STWError(std::string_view domain, int64_t code, std::string message, std::string functionName,
             uint64_t sourceFileLine, STWErrorRef underlyingError);

    std::string_view domain() const { return _domain; }
    int64_t code() const { return _code; }
    // The formatted message.
    const std::string& message() const { return _message; }
    // "FunctionName" and "SourceFileLine" of the failure site.
    const std::string& functionName() const { return _functionName; }
    uint64_t sourceFileLine() const { return _sourceFileLine; }
    const STWErrorRef& underlyingError() const { return _underlyingError; }

    bool isPOSIX(int errnoValue) const { return _domain == STWPOSIXErrorDomain && _code == errnoValue; }
    // The errno of a POSIX-domain error; 0 for any other domain, whose code is no errno.
    int posixCode() const { return _domain == STWPOSIXErrorDomain ? static_cast<int>(_code) : 0; }
    bool is(uint64_t stowlyCode) const {
        return _domain == STWErrorDomain && static_cast<uint64_t>(_code) == stowlyCode;
    }
    // What "%@" prints: domain, code, message, site and the underlying error.
    std::string description() const;

private:
    std::string_view _domain;
    int64_t _code;
    std::string _message;
    std::string _functionName;
    uint64_t _sourceFileLine;
    STWErrorRef _underlyingError;
};

// The daemon code an error answers a client with: its own in the daemon's domain, else
// `otherwise`, the code of the operation that met a failure of another domain.
inline uint64_t STWDaemonCodeOfError(const STWErrorRef& error, uint64_t otherwise) {
    return error && error->domain() == STWErrorDomain ? static_cast<uint64_t>(error->code()) : otherwise;
}

// The one constructor of error objects. `domain` must be one of the constants above.
STWErrorRef STWErrorCreatev(std::string_view domain, int64_t code, const char* function, uint64_t line,
                            STWErrorRef underlying, bool log, std::string_view format,
                            std::initializer_list<STWFormatArg> args);

template <class... Args>
STWErrorRef STWErrorCreate(std::string_view domain, int64_t code, const char* function, uint64_t line,
                           STWErrorRef underlying, bool log, std::string_view format, const Args&... args) {
    return STWErrorCreatev(domain, code, function, line, std::move(underlying), log, format,
                           {STWFormatArg(args)...});
}

// STW_ERROR(code, underlying, format, args...): an STWErrorDomain error, logged.
#define STW_ERROR(code, underlying, ...)                                                                     \
    STWErrorCreate(STWErrorDomain, static_cast<int64_t>(code), __func__, __LINE__, underlying, true,         \
                   __VA_ARGS__)
#define STW_ERROR_NOLOG(code, underlying, ...)                                                               \
    STWErrorCreate(STWErrorDomain, static_cast<int64_t>(code), __func__, __LINE__, underlying, false,        \
                   __VA_ARGS__)
// STW_POSIX_ERROR(errno, format, args...): a POSIX-domain error, logged.
#define STW_POSIX_ERROR(errnoValue, ...)                                                                     \
    STWErrorCreate(STWPOSIXErrorDomain, errnoValue, __func__, __LINE__, nullptr, true, __VA_ARGS__)
#define STW_POSIX_ERROR_NOLOG(errnoValue, ...)                                                               \
    STWErrorCreate(STWPOSIXErrorDomain, errnoValue, __func__, __LINE__, nullptr, false, __VA_ARGS__)

// Stores `e` through an optional out-parameter.
inline void STWSetError(STWErrorRef* out, STWErrorRef e) {
    if (out)
        *out = std::move(e);
}
