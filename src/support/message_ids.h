// The journal MESSAGE_IDs of the events operators alert on, fixed for good (made once with
// `systemd-id128 new`; the README lists them). Find them with `journalctl MESSAGE_ID=<id>`.
#pragma once

#include "platform/log/log.h"

// The secure-association session opened (the handshake answer was accepted).
inline constexpr platform::MessageID kMessageSessionOpened{"3b3c29f1b71344dbb4e0a7e61382ddca"};
// The session could not be opened (certificate, handshake or primitive failure).
inline constexpr platform::MessageID kMessageSessionFailed{"6d523ce6f352448487738f5e8ee24b1b"};
// A caller without the entitlement was refused (error -2).
inline constexpr platform::MessageID kMessageCallerRefused{"dd2b99edafec4c4f84b1fd2ffc602b1b"};
// An operation answered its caller with an error other than a refusal.
inline constexpr platform::MessageID kMessageOperationFailed{"6113ffeebbf84fa0b42d7f30bad01cc9"};
