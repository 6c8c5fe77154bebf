// Keeping the device root in order at the start of a run.
#pragma once

namespace platform {

// Under the current root: removes the temporary files an interrupted run
// left and submission descriptions whose log never got its name, and
// tightens what is readable or writable beyond its owner (and the
// deployment's group), one log line per path changed, except the code under
// System/, which only its installer may change. Links are never followed.
// Run it while holding the instance lock.
void TidyRoot();

}  // namespace platform
