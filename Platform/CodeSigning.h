// The code-signing status of the own process.
#pragma once

namespace sl {

// Whether the system's code-signing enforcement is off for the calling
// process. Linux enforces no code signing, so it always is.
inline bool codeSigningEnforcementIsDisabledForOwnProcess() { return true; }

}  // namespace sl
