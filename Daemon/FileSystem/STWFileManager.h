// The one place where the daemon touches the file system for containers.
//
// Used by the container cache, create-or-lookup, deletion and death row, replace, boot-time
// cleanup, per-container services, data protection and migration. It removes whole trees,
// creates directories with mode, owner and data-protection class, copies and moves (with a
// mode in which a missing source is no error), makes temporary directories, lists and walks
// directories, tests existence, reads and sets protection classes, measures disk usage, and
// decides whether a path a client sent really lies inside a container.
//
// Paths are absolute and carry no trailing separator; a "directory URL" is just the path.
// Every failure is a POSIX-domain error whose code is the errno of the failing call; a
// caller tests it with isPOSIX() and answers a client with its own code, keeping the error
// as the underlying one. The manager has no state; every operation may be called from any
// thread.
//
// Symbolic links: removal, copy, the tree walks and the protection-class operations never
// follow a link found inside the tree they work on. A path that a client sent is checked
// with realPathForURL(); to act on it without being fooled by a link swapped in after the
// check, open it with openBeneath() relative to the container's directory descriptor.
#pragma once

#include "common/STWFileDescriptor.h"
#include "common/STWError.h"

#include <cstdint>
#include <filesystem>
#include <fts.h>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <sys/types.h>
#include <vector>

// Values of createDirectoryAtURL()'s owner and class that leave the item as it is.
inline constexpr uid_t STWFileManagerOwnerUnchanged = 0;
inline constexpr int32_t STWFileManagerClassUnchanged = -1;

// The name of a container's metadata file, which the ACL and ownership walks leave alone
// (STWMetadata keeps the file; the file layer sits below it).
inline constexpr const char* STWContainerMetadataFileName = ".com.vorlane.stowly.metadata.plist";

enum STWFileManagerMoveOptions : unsigned {
    STWFileManagerMoveDefault = 0,
    // Make the move survive a power cut once it has been acknowledged: everything that is
    // moved is fsynced before the rename, and the directories that the rename changed are
    // fsynced after it (after a copy, for a move across file systems). Use it for every
    // move that makes something visible that must not be lost or half there: a staged
    // container renamed into its class directory, a metadata file or a journal renamed over
    // its target.
    STWFileManagerMoveDurable = 1u << 0,
    // Only the two directories are fsynced after the rename: the rename itself survives a
    // power cut (a container parked, replaced or put back; its content was made durable
    // when it was made). moveDirectoryAt() only.
    STWFileManagerMoveSyncDirectories = 1u << 1,
    // Only the directory the item left is fsynced: its leaving survives a power cut, where
    // it went does not matter (a move into death row). moveDirectoryAt() only.
    STWFileManagerMoveSyncSourceDirectory = 1u << 2,
};

enum STWOpenBeneathOptions : unsigned {
    STWOpenBeneathDefault = 0,
    // Refuse every symbolic link on the way, not only those that lead out of the directory.
    STWOpenBeneathNoSymlinks = 1u << 0,
};

class STWFileManager {
public:
    // Called for each entry of _traverseDirectory(); answering false stops the walk with the
    // error the visitor stored.
    using TraversalVisitor = std::function<bool(FTSENT* entry, STWErrorRef* error)>;
    // Given the current class of the item; answering false leaves it unchanged.
    using ClassPredicate = std::function<bool(int32_t currentClass)>;

    static STWFileManager* defaultManager();


    // Removes the item and, for a directory, everything below it; symbolic links are removed,
    // never followed. A missing item is removed successfully. A user-immutable item is
    // unflagged and removed. One item that cannot be removed does not stop the removal of
    // the rest; the error is the first one met.
    bool removeItemAtURL(const std::filesystem::path& url, STWErrorRef* error = nullptr) const;
    // The same for the entry `name` of the directory open as `dirfd`, a directory whose
    // ancestors the daemon trusts (death row); `path` names the item in errors and logs.
    bool removeItemAt(int dirfd, const std::string& name, const std::filesystem::path& path,
                      STWErrorRef* error = nullptr) const;

    // Creates the directory (and, with `withIntermediateDirectories`, its missing parents,
    // which get `mode` plus owner write and search). An existing directory is fine: its mode
    // stays, but it still gets `owner` (as user and group id) and `dataProtectionClass`
    // unless they are STWFileManagerOwnerUnchanged / STWFileManagerClassUnchanged. A symbolic
    // link in place of the directory is refused when an owner or class is to be set.
    // The owner-only and class-only forms are this one with the other argument
    // unchanged: as overloads of their own they would differ only in an integer type, and
    // a literal owner would silently pick the class form.
    bool createDirectoryAtURL(const std::filesystem::path& url, bool withIntermediateDirectories, mode_t mode,
                              uid_t owner, int32_t dataProtectionClass, STWErrorRef* error = nullptr) const;
    bool createDirectoryAtURL(const std::filesystem::path& url, bool withIntermediateDirectories, mode_t mode,
                              STWErrorRef* error = nullptr) const;

    // Copies recursively: data (cloned where the file system can), mode, ownership, ACLs and
    // extended attributes. Symbolic links are copied as links and never followed, at the
    // source or the destination. A failed copy may leave part of the tree behind.
    bool _copyItemAtURL(const std::filesystem::path& url, const std::filesystem::path& toURL, bool failIfSrcMissing,
                        STWErrorRef* error) const;
    bool copyItemAtURL(const std::filesystem::path& url, const std::filesystem::path& toURL,
                       STWErrorRef* error = nullptr) const;
    bool copyItemIfExistsAtURL(const std::filesystem::path& url, const std::filesystem::path& toURL,
                               STWErrorRef* error = nullptr) const;

    // Renames; across file systems copies and then removes the source (a source that cannot
    // be removed is only logged).
    bool _moveItemAtURL(const std::filesystem::path& url, const std::filesystem::path& toURL, bool failIfSrcMissing,
                        STWFileManagerMoveOptions options, STWErrorRef* error) const;
    bool moveItemAtURL(const std::filesystem::path& url, const std::filesystem::path& toURL,
                       STWErrorRef* error = nullptr) const;
    bool moveItemAtURL(const std::filesystem::path& url, const std::filesystem::path& toURL,
                       STWFileManagerMoveOptions options, STWErrorRef* error = nullptr) const;
    bool moveItemIfExistsAtURL(const std::filesystem::path& url, const std::filesystem::path& toURL,
                               STWErrorRef* error = nullptr) const;
    bool moveItemIfExistsAtURL(const std::filesystem::path& url, const std::filesystem::path& toURL,
                               STWFileManagerMoveOptions options, STWErrorRef* error = nullptr) const;

    // A new directory `withNamePrefix` + six random characters in `url`.
    std::optional<std::filesystem::path> createTemporaryDirectoryInDirectoryURL(const std::filesystem::path& url,
                                                                                const std::string& withNamePrefix,
                                                                                STWErrorRef* error = nullptr) const;
    std::optional<std::filesystem::path> createTemporaryDirectoryInDirectoryURL(const std::filesystem::path& url,
                                                                                STWErrorRef* error = nullptr) const;

    // An fts walk of the tree at `url` (physical, no chdir, one device, unsorted). An entry
    // that cannot be read or examined ends the walk with its errno.
    bool _traverseDirectory(const std::filesystem::path& url, STWErrorRef* error,
                            const TraversalVisitor& withBlock) const;

    // The entries of the directory in reading order, without those whose name begins with
    // "." (so no hidden items either). No partial result: a missing directory fails with
    // ENOENT.
    std::optional<std::vector<std::filesystem::path>> urlsForItemsInDirectoryAtURL(const std::filesystem::path& url,
                                                                                   STWErrorRef* error = nullptr) const;
    // The same listing as names, with each entry's own type (a symbolic link to a directory
    // is not a directory), taken from the listing where the file system records it: no stat
    // call per entry then. Names keep a listing of many thousand entries small; a path
    // holds a parsed copy of each of its components.
    struct DirectoryItem {
        std::string name;
        bool isDirectory = false;
    };
    std::optional<std::vector<DirectoryItem>> itemsInDirectoryAtURL(const std::filesystem::path& url,
                                                                    STWErrorRef* error = nullptr) const;
    // The same for the directory open as `dirfd` (one below a directory someone else owns,
    // opened without following links); `url` only names it in errors.
    std::optional<std::vector<DirectoryItem>> itemsInDirectoryAt(int dirfd, const std::filesystem::path& url,
                                                                 STWErrorRef* error = nullptr) const;

    // lstat-based: a dangling link exists. An item that cannot be examined (other than
    // ENOENT) answers NO to both.
    bool itemExistsAtURL(const std::filesystem::path& url) const;
    bool itemDoesNotExistAtURL(const std::filesystem::path& url) const;

    // The item's data-protection class (0 when it has none). A symbolic link is never
    // followed: opening it fails. While the device is locked, class 1 items fail with EPERM.
    bool dataProtectionClassOfItemAtURL(const std::filesystem::path& url, int32_t* dataProtectionClass,
                                        STWErrorRef* error = nullptr) const;
    bool setDataProtectionClassOfItemAtURL(const std::filesystem::path& url, int32_t toClass,
                                           const ClassPredicate& ifPredicate, STWErrorRef* error = nullptr) const;
    // The same through `fd`, a descriptor the caller opened on the item itself (a walk below
    // a directory someone else owns names nothing by path); `path` only names it in errors,
    // which are not logged here.
    bool setDataProtectionClassOfItemWithDescriptor(int fd, const std::string& path, int32_t toClass,
                                                    const ClassPredicate& ifPredicate,
                                                    STWErrorRef* error = nullptr) const;

    // Logs every item of the tree; the orphan cleanup records what it is about to remove.
    void printDirectoryStructureAtURL(const std::filesystem::path& url) const;

    // Bytes allocated to the tree, as du counts them (hard links once, one device). The fast
    // variant prefers statistics the file system maintains when the "fast_container_sizing"
    // feature is on; Linux keeps none, so both end up walking. 0 when it cannot be measured.
    // With `directoryfd` the tree is the directory open there (a container resolved beneath
    // its class directory) and `url` only names it. The walk never follows a link and opens
    // nothing but directories, so a FIFO or a link loop an app planted costs one lstat.
    uint64_t fastDiskUsageForURL(const std::filesystem::path& url, int directoryfd = -1) const;
    uint64_t diskUsageForURL(const std::filesystem::path& url, int directoryfd = -1) const;

    // The real path of `url`, a path a client sent, if it lies inside `ifChildOfURL` (the base
    // itself counts); nullopt otherwise. Refuses ".." components and absolute links, and
    // relative links that climb out of the base. "/private/var/..." and "/var/..." below the
    // root prefix name the same place on both sides.
    std::optional<std::filesystem::path> realPathForURL(const std::filesystem::path& url,
                                                        const std::filesystem::path& ifChildOfURL) const;
    std::optional<std::filesystem::path> _realPathForURL(const std::filesystem::path& url,
                                                         bool allowNonExistentPathComponents) const;
    // The real path of the longest existing prefix (two components or more) of `path`,
    // with the rest appended.
    std::optional<std::filesystem::path> _realPathWhatExistsInPath(const std::string& path) const;
    // Walks `path` lexically from `withStartingDepth` ("..": -1; "", ".": 0; others: +1) and
    // fails as soon as the depth drops below the start; stores the final depth.
    static bool _validateSymlink(std::string_view path, int32_t withStartingDepth, int32_t* andEndingDepth);

    // Opens `relativePath` beneath the directory `dirfd` so that no "..", absolute path or
    // symbolic link (nor a /proc magic link) can lead out of it, however the tree changes
    // meanwhile: openat2 with RESOLVE_BENEATH, or where the kernel lacks it a walk of
    // O_NOFOLLOW opens that refuses every link and every "..". `mode` is used with O_CREAT.
    // (The path is a plain string: it is on the path of every metadata read, and a
    // std::filesystem::path parses its components when it is made.)
    STWFileDescriptor openBeneath(int dirfd, const std::string& relativePath, int flags, mode_t mode,
                                  unsigned options, STWErrorRef* error = nullptr) const;
    // The walk of O_NOFOLLOW opens on its own (for kernels without openat2, and for tests).
    STWFileDescriptor _openBeneathByComponents(int dirfd, const std::filesystem::path& relativePath, int flags,
                                               mode_t mode, STWErrorRef* error = nullptr) const;

    // MARK: Below a directory someone else owns
    //
    // Apps own their containers and the per-user class and staging directories, and may
    // replace anything in them at any moment. Below such a directory the daemon names
    // nothing by a path string: it opens each directory from its parent's descriptor
    // without following links and acts on the descriptors (the `path` arguments only name
    // the item in errors and logs). The anchor is a directory whose ancestors it trusts,
    // opened with openDirectoryAtURL().

    // Opens the directory itself, never a link in its place (O_DIRECTORY|O_NOFOLLOW).
    STWFileDescriptor openDirectoryAtURL(const std::filesystem::path& url, STWErrorRef* error = nullptr) const;
    // The same for a directory below `trustedAncestor` (a user's home, whose parent only
    // root may change): the ancestor as its path says, every component below it without
    // following a link. An empty ancestor, or one that `url` is not below, is the form
    // above.
    STWFileDescriptor openDirectoryAtURL(const std::filesystem::path& url,
                                         const std::filesystem::path& trustedAncestor,
                                         STWErrorRef* error = nullptr) const;

    // The same for a path that comes without an owner to tell its trusted ancestor (a
    // journal's, say): the ancestor is the deepest directory that only root can change
    // (every directory from "/" down to it owned by root and writable by nobody else unless
    // sticky; a link of root's counts when what it leads to qualifies).
    STWFileDescriptor openDirectoryAtURLWithoutForeignLinks(const std::filesystem::path& url,
                                                            STWErrorRef* error = nullptr) const;
    // Moves the item at `from` to `to`, never over an existing item, both directories opened
    // as above; what arrives is checked to be what was there (see moveDirectoryAt). ENOENT
    // when nothing is at `from`.
    bool moveItemAtURLWithoutForeignLinks(const std::filesystem::path& from, const std::filesystem::path& to,
                                          STWFileManagerMoveOptions options, STWErrorRef* error = nullptr) const;
    // The same into the directory open as `tofd`, as `toName`; `to` names the destination in
    // errors.
    bool moveItemAtURLWithoutForeignLinks(const std::filesystem::path& from, int tofd, const std::string& toName,
                                          const std::filesystem::path& to, STWFileManagerMoveOptions options,
                                          STWErrorRef* error = nullptr) const;
    // Removes the directory open as `directoryfd`, the entry `name` of `parentfd`: what it
    // holds through its descriptor, then the entry itself while it is still that directory
    // (ESTALE when something else took its place; that is left alone). A directory that is
    // gone already counts as removed.
    bool removeDirectoryAt(int parentfd, const std::string& name, int directoryfd, const std::filesystem::path& path,
                           STWErrorRef* error = nullptr) const;

    // Makes the directory `relativePath` below `dirfd` one component at a time and answers
    // its descriptor. A symbolic link found where a directory belongs is removed and a
    // directory made in its place; any other kind of item fails with ENOTDIR. Directories it
    // makes get `mode` (the parents plus owner write and search); an existing one keeps its
    // mode. The last directory gets `owner` (user and group) and `dataProtectionClass`,
    // unless they are the Unchanged values.
    STWFileDescriptor createDirectoryBeneath(int dirfd, const std::filesystem::path& relativePath, mode_t mode,
                                             uid_t owner, int32_t dataProtectionClass,
                                             const std::filesystem::path& path, STWErrorRef* error = nullptr) const;

    // Makes the new directory `name` in `dirfd` (EEXIST when the name is taken) and answers
    // its descriptor, with owner and class as above. In a directory that someone else may
    // write the new entry can be swapped before it is opened, so what is opened must be a
    // directory of the daemon's own (ESTALE otherwise).
    STWFileDescriptor createNewDirectoryAt(int dirfd, const std::string& name, mode_t mode, uid_t owner,
                                           int32_t dataProtectionClass, const std::filesystem::path& path,
                                           STWErrorRef* error = nullptr) const;

    // A new directory `namePrefix` + six random characters in the directory open as `dirfd`
    // (`directory` names it in errors), made as createNewDirectoryAt() makes one, mode 0700:
    // createTemporaryDirectoryInDirectoryURL() for a directory the caller holds open.
    struct TemporaryDirectory {
        STWFileDescriptor fd;
        std::string name;
    };
    std::optional<TemporaryDirectory> createTemporaryDirectoryAt(int dirfd, const std::string& namePrefix,
                                                                 const std::filesystem::path& directory,
                                                                 STWErrorRef* error = nullptr) const;

    // Renames `name` of `fromfd` to `toName` of `tofd`, never over an existing item, and
    // checks that what arrived is the directory open as `directoryfd`: if an item swapped
    // in for it arrived instead, that is moved back and the move fails with ESTALE. With
    // STWFileManagerMoveDurable the tree is synced before and both directories after; a
    // failed sync after the rename moves the directory back, so a failed move has always
    // left the directory where it was.
    bool moveDirectoryAt(int fromfd, const std::string& name, int tofd, const std::string& toName, int directoryfd,
                         STWFileManagerMoveOptions options, const std::filesystem::path& from,
                         const std::filesystem::path& to, STWErrorRef* error = nullptr) const;

    // A new file beside the file it will replace: written, synced and still open.
    struct TemporaryFile {
        STWFileDescriptor fd;
        std::string name;
    };
    std::optional<TemporaryFile> writeTemporaryFileAt(int dirfd, std::string_view contents, mode_t mode,
                                                      const std::filesystem::path& directory,
                                                      STWErrorRef* error = nullptr) const;
    // Renames the temporary file over `name` of `dirfd` and syncs the directory; on failure
    // the temporary file is removed. With `immutable` the old file's user-immutable flag is
    // cleared for the rename and the new file gets it, where the file system has the flag.
    // `identity` gets the new file's status.
    bool replaceFileAt(int dirfd, TemporaryFile& file, const std::string& name, bool immutable, struct stat* identity,
                       const std::filesystem::path& path, STWErrorRef* error = nullptr) const;

    // Sets or clears the user-immutable flag of a file or directory (never through a link).
    // A file system without the flag succeeds.
    bool setUserImmutableOfItemAtURL(const std::filesystem::path& url, bool immutable,
                                     STWErrorRef* error = nullptr) const;

    // MARK: ACLs and ownership of container trees
    //
    // System containers (and system group containers) are shared by system processes of
    // different users: what lies below the container directory is owned by nobody, has no
    // permission bits and carries one ACL entry that gives the group "systemusers" full
    // access; the container directory itself lets the group create items and hands full
    // rights down through its default ACL. Ordinary containers get owner and modes instead.
    // The walks never follow a link and never act outside the tree, however its owner
    // rearranges it meanwhile: they act on descriptors opened from the parent's descriptor.
    // An item they cannot change is logged and skipped; only a walk that cannot start or
    // read a directory fails. The container's metadata file (and anything whose name
    // contains its name) is left alone, and so is an item with hard links that were not
    // all met inside the tree. ACL failures are code 63; a missing "systemusers" group is
    // one. The path forms open the root without following a link; the descriptor forms act
    // on the directory open as `rootfd` (`path` names it in errors and logs).

    // The container directory's ACL: the group may create and name items there; everything
    // made below inherits full access.
    bool setTopLevelSystemContainerACLAtURL(const std::filesystem::path& url, STWErrorRef* error = nullptr) const;
    bool setTopLevelSystemContainerACLAt(int rootfd, const std::filesystem::path& path,
                                         STWErrorRef* error = nullptr) const;
    // Every item below the root: mode 000, owner and group nobody, the group's ACL. The root
    // gets the top-level ACL when `isSystemContainer` (mode and owner untouched), else the
    // same as everything below (content staged into a system group container, which may
    // also be a single file).
    bool standardizeACLsAtURL(const std::filesystem::path& url, bool isSystemContainer,
                              STWErrorRef* error = nullptr) const;
    bool standardizeACLsAt(int rootfd, const std::filesystem::path& path, bool isSystemContainer,
                           STWErrorRef* error = nullptr) const;
    bool standardizeACLsForSystemContainerAtURL(const std::filesystem::path& url, STWErrorRef* error = nullptr) const;
    // Each entry of a directory of system containers; a missing or empty directory is
    // success. One container that fails does not stop the others, but fails the result.
    bool standardizeAllSystemContainerACLsAtURL(const std::filesystem::path& url, STWErrorRef* error = nullptr) const;
    // Owner (uid, gid) for the tree and the root, mode 0755 for directories and anything with
    // an execute bit, 0644 for the rest; links are re-owned only.
    bool standardizeOwnershipAtURL(const std::filesystem::path& url, uid_t uid, gid_t gid,
                                   STWErrorRef* error = nullptr) const;
    bool standardizeOwnershipAt(int rootfd, const std::filesystem::path& path, uid_t uid, gid_t gid,
                                STWErrorRef* error = nullptr) const;

    // Tests observe every fsync made for durability, with the path synced.
    static void setSyncObserverForTesting(std::function<void(const std::string& path)> observer);

private:
    STWFileManager() = default;

    // The one directory listing behind both public forms: `body` sees each entry whose name
    // does not begin with "." and the descriptor of the open directory. Errors carry
    // `function` as their function name.
    bool _forEachItemInDirectory(const std::string& path, const char* function, STWErrorRef* error,
                                 const std::function<void(int directory, const struct dirent& entry)>& body) const;
    // The same through `dirfd` when it is not -1.
    bool _forEachItemInDirectory(const std::string& path, const char* function, STWErrorRef* error, int dirfd,
                                 const std::function<void(int directory, const struct dirent& entry)>& body) const;
};
