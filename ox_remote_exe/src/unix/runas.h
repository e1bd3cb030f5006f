// Whom the process runs as, when root started it.
#pragma once

#include <functional>

// Told of each call that failed, by name and errno; no failure stops the program.
using RunAsFailure = std::function<void(const char* call, int error)>;

// Takes root's whole identity back, where root is the real user.
void TakeRoot();
// The group to run as, and no other: root's further groups would stay with the scripts. Needs root.
void TakeGroup(int gid, const RunAsFailure& failed);
// The effective user. The real one stays root, for privileged ports and the checks of system accounts.
void TakeEffectiveUser(int uid, const RunAsFailure& failed);
// For a program that an ordinary user started: gives up whatever a set-uid bit brought.
void DropSetUid();
