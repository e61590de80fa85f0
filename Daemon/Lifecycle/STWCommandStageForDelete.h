// The fast half of a deletion: each container is renamed into death row and dropped from
// the container cache; a later death-row pass removes it from the disk.
#pragma once

#include "Daemon/Lifecycle/STWCommand.h"
#include "Daemon/Model/STWContainerIdentity.h"
#include "Daemon/Model/STWMetadata.h"

#include <functional>
#include <memory>
#include <vector>

class STWCommandStageForDelete : public STWCommand {
public:
    using ErrorHandler = std::function<void(uint64_t)>;

    // Identities may be concrete (the very container of that UUID) or not (the container the
    // cache has for the identity). With `useLocking` the daemon-wide write lock is held for
    // the whole command. `onError` is called once with the code when a container could not
    // be found or the command stopped.
    static std::shared_ptr<STWCommandStageForDelete>
    commandForStageForDeleteWithContainerIdentities(std::vector<STWContainerIdentityRef> containerIdentities,
                                                    bool useLocking, ErrorHandler onError);
    STWCommandStageForDelete(std::vector<STWContainerIdentityRef> containerIdentities, bool useLocking,
                             ErrorHandler onError);

    static constexpr uint64_t commandNumber = 3;
    uint64_t command() const override { return commandNumber; }
    // A container that cannot be moved into death row is removed where it is; one that can
    // be neither stays (logged). Fails only when the cache refuses to drop a container (46)
    // or on an exception (40); a container not found sets the error but not the result.
    bool fromQueue(STWCommandQueue& queue, uint64_t* error) override;

    const std::vector<STWContainerIdentityRef>& containerIdentities() const { return _containerIdentities; }
    bool useLocking() const { return _useLocking; }
    const ErrorHandler& onError() const { return _onError; }

private:
    // Moves the record's own directory into death row, or removes it in place; true when the
    // container is no longer in its class directory.
    static bool _stageContainer(const STWMetadata& record);
    // The code-signing mapping forgets the identifier and its children; the groups they were
    // the last to reference are queued for deletion on `queue`.
    static void _removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier,
                                                                          STWCommandQueue& queue);

    std::vector<STWContainerIdentityRef> _containerIdentities;
    bool _useLocking;
    ErrorHandler _onError;
};
