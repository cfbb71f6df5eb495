// The program-wide settings that processes read while they gather and the analysis reads
// afterwards. The driver sets them before gathering starts. RKMemspread exposes them as its class
// settings; they live here so that the process layer can read them without the analysis layer.
#pragma once

class RKAnalysisSettings {
public:
    // Owned-memory accounting (the default mode) as opposed to the VM-object view of
    // --vmObjectDirty. Stored in the platform's vm.self_region_memspread setting with a cached
    // copy: reading twice asks the platform once, setting makes the next read ask again.
    static bool breakDownPhysMemspread();
    static void setBreakDownPhysMemspread(bool on);

    static bool isSharingAnalysisDisabled();
    static void setSharingAnalysisDisabled(bool disabled);

    // Whether frames are read to count anonymous memory shared across fork or by KSM once, in
    // its exact sharing set (MEMSPREAD_FORK_SHARING=off turns it off: the run then costs what a
    // run without root costs, and such memory counts once per process that maps it).
    static bool isForkSharingDisabled();
    static void setForkSharingDisabled(bool disabled);
    // Reads MEMSPREAD_FORK_SHARING ("on", "off", or unset). False, after a message on standard
    // error naming the variable and the value, for any other value.
    static bool applyEnvironment(const char* program);

    // Forgets the cached breakdown value (tests that swap platforms).
    static void resetCache();
};
