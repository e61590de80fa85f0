// The keybag stand-in: the device's lock state, kept in ROOT/run/stowly/keybag
// ("locked" or "unlocked"; missing means unlocked), with notifications when it changes.
// The file layer refuses protection-class work on class 1 items while the device is
// locked; the daemon suspends its lock-state queue meanwhile.
#pragma once

#include <functional>
#include <optional>

enum STWKeybagLockState : int {
    STWKeybagUnlocked = 0,
    STWKeybagLocked = 1,
};

class STWKeybag {
public:
    static bool isDeviceLocked();
    static STWKeybagLockState lockState() { return isDeviceLocked() ? STWKeybagLocked : STWKeybagUnlocked; }

    // Calls `callback` on the event loop whenever the state file may have changed.
    // Returns false with errno set when the runtime directory cannot be watched.
    static bool registerForLockStateNotifications(std::function<void()> callback);

    // Tests force a state without writing the file; nullopt goes back to the file.
    static void setLockStateOverrideForTesting(std::optional<bool> locked);
};
