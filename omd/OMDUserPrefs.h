// The daemon's view of the current user's preference domain "com.orvex.ombrel.userprefs". The
// daemon only reads it: the user's settings write it.
#pragma once

#include "platform/Preferences.h"
#include "platform/Value.h"

namespace om {

class OMDUserPrefs : public Preferences {
public:
    static constexpr const char* kDomain = "com.orvex.ombrel.userprefs";

    OMDUserPrefs();
    // The "exclusions" value as the domain's file holds it now: an array of match dictionaries, or
    // none (also for a value of another kind, which hides nothing).
    Value exclusions();
};

} // namespace om
