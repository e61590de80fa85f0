// The reader of container metadata files, on whatever bytes the file holds, entered as the
// container cache enters it when it rebuilds a class: beneath the class directory's
// descriptor, for the personal user identity, with the class path checked. The first byte
// picks the class directory the container lies in (a metadata file of one class inside the
// directory of another must be refused); the rest is the file. Whatever the reader
// accepts must name a class whose directory that is, carry the expected user identity
// where the class has one, and read back unchanged once the daemon rewrites it.
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWMetadata.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "common/STWPropertyList.h"
#include "fuzz/STWFuzzRoot.h"

#include <array>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>

namespace {

constexpr const char* kContainerName = "8A0C1C0E-6C1B-4F5B-9C7E-2D6F3B1A9E42";

struct ClassDirectory {
    std::filesystem::path url;
    STWFileDescriptor fd;
};

// The class directory of every class, with one container directory in it.
const ClassDirectory& classDirectory(STWContainerClass containerClass) {
    static const std::array<ClassDirectory, 13> directories = [] {
        STWFuzzRoot();
        auto personal = STWUserIdentitySharedCache::sharedInstance()->userIdentityForPersonalPersona();
        std::array<ClassDirectory, 13> all;
        for (STWContainerClass c = 1; c <= 13; ++c) {
            auto url = STWGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(personal, c, false);
            if (!url)
                abort();
            std::filesystem::create_directories(*url / kContainerName);
            all[c - 1].url = *url;
            all[c - 1].fd = STWFileDescriptor(open(url->c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
            if (!all[c - 1].fd)
                abort();
        }
        return all;
    }();
    return directories[containerClass - 1];
}

std::shared_ptr<STWMetadata> read(const ClassDirectory& directory, const STWUserIdentityRef& personal,
                                  STWErrorRef* error) {
    return STWMetadata::readAndValidateMetadataInDirectory(directory.fd.get(), kContainerName,
                                                           directory.url / kContainerName, personal, true, error);
}

[[noreturn]] void fail(const char* what, const STWMetadata& record) {
    fprintf(stderr, "metadata fuzzer: %s: %s\n", what, record.description().c_str());
    abort();
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0)
        return 0;
    STWContainerClass directoryClass = 1 + data[0] % 13;
    const ClassDirectory& directory = classDirectory(directoryClass);
    auto personal = STWUserIdentitySharedCache::sharedInstance()->userIdentityForPersonalPersona();
    std::filesystem::path file = directory.url / kContainerName / STWMetadata::fileName;
    STWFuzzWriteInput(file, data + 1, size - 1);

    STWErrorRef error;
    auto record = read(directory, personal, &error);
    if (!record) {
        if (!error || (error->code() != STWErrorReadFileFailed && error->code() != STWErrorInvalidContent))
            abort();
        return 0;
    }
    if (STWContainerClassDirectoryName(record->containerClass()) != STWContainerClassDirectoryName(directoryClass))
        fail("accepted in the directory of another class", *record);
    if (STWUserIdentity::isUserIdentityRequiredForContainerClass(record->containerClass()) &&
        !(record->userIdentity() && *record->userIdentity() == *personal))
        fail("accepted for another user identity", *record);
    if (record->url() != directory.url / kContainerName)
        fail("read with another path", *record);

    // The daemon rewrites the file from the record (a new UUID, an info value): what it
    // writes must read back as the same container.
    std::string rewritten = STWPropertyList::serializeBinary(STWValue(record->dictionaryRepresentation()));
    STWFuzzWriteInput(file, reinterpret_cast<const uint8_t*>(rewritten.data()), rewritten.size());
    STWErrorRef rereadError;
    auto reread = read(directory, personal, &rereadError);
    if (!reread)
        fail(("rewritten file refused: " + STWFormat("%@", rereadError)).c_str(), *record);
    bool sameInfo = record->info().has_value() == reread->info().has_value() &&
                    (!record->info() || STWValue(*record->info()).isIdenticalTo(STWValue(*reread->info())));
    if (reread->containerClass() != record->containerClass() || reread->identifier() != record->identifier() ||
        reread->uuid() != record->uuid() || !(*reread->userIdentity() == *record->userIdentity()) || !sameInfo ||
        reread->userManagedAssetsDirName() != record->userManagedAssetsDirName())
        fail(("rewritten file reads as another container: " + reread->description()).c_str(), *record);
    return 0;
}
