// Makes chosen system calls of the file layer fail, so that tests can prove that a failure
// at any step of a change on disk leaves nothing half-made.
//
// Every call by which the file layer changes the disk passes a named point first (the
// `disk::` calls of STWFileSystemPrimitives.h). A fault armed at a point makes the nth call
// through it, counted from the arming, fail with the chosen errno without being made; the
// fault is then spent and later calls go through. The points:
//
//   "mkdirat"    a new directory: mkdir, mkdirat, mkdtemp
//   "create"     a new file, symbolic link or node: open with O_CREAT, symlinkat, mknodat
//   "write"      the data of a file: each file written or copied counts once
//   "fsync"      fsync of a file or directory
//   "renameat2"  rename, renameat, renameat2
//   "fchown"     fchown, fchownat
//   "fchmod"     fchmod, fchmodat
//   "setxattr"   extended attributes: protection classes, ACLs, copied attributes
//   "setflags"   the user-immutable inode flag
//   "unlinkat"   unlink, unlinkat, rmdir
//
// Unit tests arm faults in their own process with arm(). A daemon started by the tests takes
// them from the environment variable STOWLY_FAULT once its start-up is done, just before it
// serves requests (so calls are counted from there): a comma-separated list of
// POINT:N:ERRNO, so "renameat2:1:28,fsync:3:5" fails the first rename with ENOSPC and the
// third sync with EIO. The list is honoured only where the configuration says
// InternalImage; elsewhere it is logged and dropped. Every fault that fires is logged with
// its point, call and errno.
//
// Nothing armed, a point costs one load of an atomic flag. Safe from any thread; counting
// and firing are serialized by one mutex that only armed points take.
#pragma once

#include <atomic>
#include <string_view>

enum class STWFaultPoint : unsigned {
    MakeDirectory,
    Create,
    Write,
    Sync,
    Rename,
    ChangeOwner,
    ChangeMode,
    SetAttribute,
    SetFlags,
    Remove,
    Count
};

class STWFaultInjection {
public:
    static constexpr const char* environmentVariable = "STOWLY_FAULT";

    // The errno that the current call through `point` must fail with; 0 to make the call.
    static int check(STWFaultPoint point) {
        if (__builtin_expect(!_armed.load(std::memory_order_relaxed), 1))
            return 0;
        return _fire(point);
    }

    // Makes the `nth` call (1 is the next one) through the point named `name` fail with
    // `error`, replacing what was armed there. False, arming nothing, for an unknown name,
    // an n of 0 or an errno of 0.
    static bool arm(std::string_view name, unsigned nth, int error);
    // Arms a list in the form of STOWLY_FAULT; false, arming nothing, when any entry is
    // malformed.
    static bool armFromList(std::string_view list);
    // Disarms every point.
    static void disarm();
    // Arms the list of STOWLY_FAULT, when there is one and `internalImage`.
    static void armFromEnvironment(bool internalImage);

private:
    static int _fire(STWFaultPoint point);

    static std::atomic<bool> _armed;
};
