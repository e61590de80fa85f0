#include "Daemon/Request/STWClientConnection.h"

#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "common/STWException.h"


STWClientConnection::STWClientConnection()
    : _backgroundQueue(_sharedBackgroundQueue()), _entitled(true), _allowOtherIdLookup(false), _unrestricted(true),
      _clientIdentity(STWClientIdentity::anonymousPrivilegedClientIdentity()), _commandQueue(STWCommandQueue::init()),
      _userIdentityCache(STWUserIdentitySharedCache::sharedInstance()) {}

STWClientConnection::STWClientConnection(STWClientIdentityRef clientIdentity, bool entitled, bool allowOtherIdLookup,
                                         bool unrestricted, std::optional<STWValue::Dictionary> lookup,
                                         std::optional<STWValue::Array> entitledWipeIdentifiers,
                                         std::shared_ptr<STWCommandQueue> commandQueue)
    : _backgroundQueue(_sharedBackgroundQueue()), _entitled(entitled), _allowOtherIdLookup(allowOtherIdLookup),
      _unrestricted(unrestricted), _clientIdentity(std::move(clientIdentity)), _commandQueue(std::move(commandQueue)),
      _entitledWipeIdentifiers(std::move(entitledWipeIdentifiers)), _lookup(std::move(lookup)),
      _userIdentityCache(STWUserIdentitySharedCache::sharedInstance()) {}

const std::shared_ptr<STWClientConnection>& STWClientConnection::sharedClientConnection() {
    static const std::shared_ptr<STWClientConnection> shared = std::make_shared<STWClientConnection>();
    return shared;
}

std::shared_ptr<STWClientConnection>
STWClientConnection::privilegedClientConnectionWithUserIdentity(STWUserIdentityRef userIdentity) {
    return std::make_shared<STWClientConnection>(
        STWClientIdentity::privilegedClientIdentityWithUserIdentity(std::move(userIdentity)), true, true, true,
        std::nullopt, std::nullopt, STWCommandQueue::init());
}

const std::shared_ptr<STWQueue>& STWClientConnection::_sharedBackgroundQueue() {
    static const std::shared_ptr<STWQueue> queue = STWQueue::create(
        "com.vorlane.stowlyd.background", {.priority = STWQueue::Priority::Background, .holdsTransactions = true});
    return queue;
}

bool STWClientConnection::completeWithError(uint64_t* error) {
    return _commandQueue->executeAllUntilExhaustedOrError(error);
}

bool STWClientConnection::isEntitledForLookupWithClass(STWContainerClass containerClass, std::string_view identifier) {
    auto identifiers = _lookupForContainerClass(containerClass);
    return identifiers && identifiers->count(identifier) > 0;
}

std::optional<STWClientConnection::StringSet> STWClientConnection::_lookupForContainerClass(STWContainerClass containerClass) {
    std::string_view word = STWContainerClassLookupWord(containerClass);
    if (word.empty() || !_lookup)
        return std::nullopt;
    STWLockGuard guard(_lock);
    auto it = _sanitizedLookup.find(word);
    if (it == _sanitizedLookup.end()) {
        // A value that is not an array (a lone string, a number) allows nothing.
        const STWValue* value = STWDictionaryFind(*_lookup, word);
        StringSet identifiers = value && value->array() ? _setOfStringsFromArray(*value->array()) : StringSet();
        it = _sanitizedLookup.emplace(std::string(word), std::move(identifiers)).first;
    }
    return it->second;
}

STWClientConnection::StringSet STWClientConnection::_setOfStringsFromArray(const STWValue::Array& array) {
    StringSet result;
    for (const STWValue& element : array)
        if (const std::string* s = element.string())
            result.insert(*s);
    return result;
}

std::optional<std::string> STWClientConnection::clientBundleIdentifier() const {
    if (!_clientIdentity)
        return std::nullopt;
    return _clientIdentity->bundleIdentifier();
}

void STWClientConnection::setClientBundleIdentifier(std::optional<std::string> identifier) {
    STWLockGuard guard(_lock);
    _clientBundleIdentifier = std::move(identifier);
}

std::optional<STWValue::Array> STWClientConnection::entitledWipeIdentifiers() const {
    STWLockGuard guard(_lock);
    return _entitledWipeIdentifiers;
}

void STWClientConnection::setEntitledWipeIdentifiers(std::optional<STWValue::Array> identifiers) {
    STWLockGuard guard(_lock);
    _entitledWipeIdentifiers = std::move(identifiers);
}

uint64_t STWClientConnection::_codeOfError(const STWErrorRef& error) {
    if (error && error->domain() == STWErrorDomain)
        return static_cast<uint64_t>(error->code());
    // Operations wrap the errors of other domains in their own code before they get here;
    // one that did not still reaches the log whole, under the code it is answered with.
    STW_ERROR(STWErrorItemOperationFailed, error, "Failed to operate on an item");
    return STWErrorItemOperationFailed;
}

void STWClientConnection::_reportException(const char* function) {
    STWErrorForCurrentException(function, __LINE__,
                                STWExceptionReportForImage(STWGlobalConfiguration::sharedInstance()->isInternalImage()));
}
