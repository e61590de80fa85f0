#include "common/STWError.h"

#include "common/STWLog.h"

#include <cstring>

namespace {

struct CodeEntry {
    uint64_t code;
    const char* name;
    const char* meaning;
};

// Every code of STWErrorDomain, in order: its constant's name and what it means to a client.
// clang-format off
#define CODE(c, meaning) {STWError##c, #c, meaning}
// clang-format on
constexpr CodeEntry codeTable[] = {
    CODE(Success, "success"),
    CODE(MoveDirectoryFailed, "could not move a directory"),
    CODE(RemoveTransientFailed, "could not remove a transient container"),
    CODE(CreateSubdirectoryFailed, "could not create a container subdirectory"),
    CODE(CreateStagingFailed, "could not create a staging directory"),
    CODE(MoveStagingFailed, "could not move a staging directory to the live location"),
    CODE(RemoveStagingFailed, "could not remove a staging directory"),
    CODE(InvalidPath, "invalid path: not what it must be, or changed on disk"),
    CODE(InvalidClass, "invalid container class, or no user for the persona"),
    CODE(ReadFileFailed, "could not read a metadata or update file"),
    CODE(MoveToStagingFailed, "could not move an old container to staging"),
    CODE(ReplaceFailed, "could not replace a container"),
    CODE(DestroyFailed, "could not destroy an item"),
    CODE(NoIdentifier, "no identifier given"),
    CODE(UnexpectedClass, "unexpected or invalid container class"),
    CODE(NotFound, "not found (container, code-signing information or system group container)"),
    CODE(ReplaceWithSelf, "a container cannot replace itself"),
    CODE(ReplaceAcrossClasses, "a container cannot replace one of another class"),
    CODE(InfoValueNotFound, "no info value for the key"),
    CODE(AlreadyExists, "the container already exists"),
    CODE(DeleteFailed, "could not delete a container"),
    CODE(InvalidContent, "invalid content in a metadata or data-protection update file"),
    CODE(InvalidReplaceInfo, "invalid replace information"),
    CODE(WriteFileFailed, "could not write a file"),
    CODE(BadReplaceFile, "bad or unreadable replace file"),
    CODE(RemovePendingFileFailed, "could not remove a pending operation file"),
    CODE(InvalidArgument, "invalid argument"),
    CODE(Exception, "an exception was caught"),
    CODE(ItemOperationFailed, "could not create, move or remove an item"),
    CODE(CacheRebuildFailed, "the container cache could not be rebuilt"),
    CODE(MetadataMissing, "inconsistent container: metadata missing"),
    CODE(CacheAddFailed, "could not add to the container cache"),
    CODE(CacheRemoveFailed, "could not remove from the container cache"),
    CODE(CacheInvalidInput, "invalid class, identifier or path given to the container cache"),
    CODE(MoveToNewUUIDFailed, "could not move a container to a new UUID directory"),
    CODE(UnsupportedCommand, "invalid or unsupported command"),
    CODE(NotEntitled, "not entitled"),
    CODE(CountMismatch, "invalid input: value and identifier counts differ"),
    CODE(DeviceLocked, "the device is locked and the operation was not to be retried"),
    CODE(ChangeOwnerFailed, "could not change owner"),
    CODE(SetACLFailed, "could not set an ACL"),
    CODE(MoveFailed, "move failed"),
    CODE(Database, "a database operation failed"),
    CODE(IdentifierNotInDatabase, "identifier not found in the code-signing database"),
    CODE(UnexpectedRowCount, "unexpected number of database rows changed"),
    CODE(Superseded, "superseded by a newer operation on the same container"),
    CODE(UserManagedPathNotFound, "user-managed path not found"),
    CODE(AllocationFailed, "allocation failed"),
    CODE(MalformedUserIdentity, "malformed stored user identity"),
    CODE(PersonaMismatch, "persona mismatch or ambiguity"),
    CODE(CommandQueueExhausted, "command queue exhausted"),
};
#undef CODE

const CodeEntry* codeEntry(uint64_t code) {
    for (const CodeEntry& entry : codeTable)
        if (entry.code == code)
            return &entry;
    return nullptr;
}

} // namespace

const char* STWErrorCodeName(uint64_t code) {
    const CodeEntry* entry = codeEntry(code);
    return entry ? entry->name : nullptr;
}

const char* STWErrorCodeMeaning(uint64_t code) {
    const CodeEntry* entry = codeEntry(code);
    return entry ? entry->meaning : nullptr;
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
