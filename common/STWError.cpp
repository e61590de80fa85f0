#include "common/STWError.h"

#include "common/STWLog.h"

#include <cstring>

const char* STWErrorCodeName(uint64_t code) {
    switch (code) {
#define NAME(c)                                                                                              \
    case STWError##c:                                                                                        \
        return #c;
        NAME(Success)
        NAME(MoveDirectoryFailed)
        NAME(RemoveTransientFailed)
        NAME(CreateSubdirectoryFailed)
        NAME(CreateStagingFailed)
        NAME(MoveStagingFailed)
        NAME(RemoveStagingFailed)
        NAME(InvalidPath)
        NAME(InvalidClass)
        NAME(ReadFileFailed)
        NAME(MoveToStagingFailed)
        NAME(ReplaceFailed)
        NAME(DestroyFailed)
        NAME(NoIdentifier)
        NAME(UnexpectedClass)
        NAME(NotFound)
        NAME(ReplaceWithSelf)
        NAME(ReplaceAcrossClasses)
        NAME(InfoValueNotFound)
        NAME(AlreadyExists)
        NAME(DeleteFailed)
        NAME(InvalidContent)
        NAME(InvalidReplaceInfo)
        NAME(WriteFileFailed)
        NAME(BadReplaceFile)
        NAME(RemovePendingFileFailed)
        NAME(InvalidArgument)
        NAME(Exception)
        NAME(ItemOperationFailed)
        NAME(CacheRebuildFailed)
        NAME(MetadataMissing)
        NAME(CacheAddFailed)
        NAME(CacheRemoveFailed)
        NAME(CacheInvalidInput)
        NAME(MoveToNewUUIDFailed)
        NAME(UnsupportedCommand)
        NAME(NotEntitled)
        NAME(CountMismatch)
        NAME(DeviceLocked)
        NAME(ChangeOwnerFailed)
        NAME(SetACLFailed)
        NAME(MoveFailed)
        NAME(Database)
        NAME(IdentifierNotInDatabase)
        NAME(UnexpectedRowCount)
        NAME(Superseded)
        NAME(UserManagedPathNotFound)
        NAME(AllocationFailed)
        NAME(MalformedUserIdentity)
        NAME(PersonaMismatch)
        NAME(CommandQueueExhausted)
#undef NAME
    }
    return nullptr;
}

STWError::STWError(std::string_view domain, int64_t code, std::string message, std::string functionName,
                   uint64_t sourceFileLine, STWErrorRef underlyingError)
    : _domain(domain), _code(code), _message(std::move(message)), _functionName(std::move(functionName)),
      _sourceFileLine(sourceFileLine), _underlyingError(std::move(underlyingError)) {}

std::string STWError::description() const {
    std::string text = STWFormat("Error Domain=%s Code=%lld \"%s\" {FunctionName=%s, SourceFileLine=%llu",
                                 _domain, _code, _message, _functionName, _sourceFileLine);
    if (posixCode() > 0)
        text += STWFormat(", Reason=%s", strerror(posixCode()));
    if (_underlyingError)
        text += ", UnderlyingError=" + _underlyingError->description();
    return text + "}";
}

STWErrorRef STWErrorCreatev(std::string_view domain, int64_t code, const char* function, uint64_t line,
                            STWErrorRef underlying, bool log, std::string_view format,
                            std::initializer_list<STWFormatArg> args) {
    auto error = std::make_shared<const STWError>(domain, code, STWFormatv(format, args), function, line,
                                                  std::move(underlying));
    if (log)
        STW_LOG_FN(function, STWLogLevel::Error, STWLogCategory::Unspecified, "%@", *error);
    return error;
}
