// Reads the device's lock state for the file layer, which must refuse protection-class
// work on class 1 items while the device is locked.
//
// The state is the keybag stand-in file ROOT/run/stowly/keybag ("locked" or "unlocked";
// missing means unlocked). A later change adds lock-state notifications.
#pragma once

#include <optional>

class STWKeybag {
public:
    static bool isDeviceLocked();

    // Tests force a state without writing the file; nullopt goes back to the file.
    static void setLockStateOverrideForTesting(std::optional<bool> locked);
};
