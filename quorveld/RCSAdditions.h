// RCSAdditions: the daemon's additions to a client connection — its validity
// flag, a small dictionary of values attached to it, and the connection whose
// call is being delivered on the calling thread. Attached values live and die
// with the connection object.
//
// Free functions over platform::Connection. The flag may be read and set from
// any thread; user-info values are stored only on the service serial queue
// (the fetch-then-create of the dictionary relies on that).
#pragma once

#include <any>
#include <memory>
#include <string>

#include "platform/dbus/Connection.h"

namespace quorvel {

// False until set (a connection that never went through the listener).
bool rcs_isValid(const platform::Connection& connection);
void rcs_setValid(platform::Connection& connection, bool valid);

// Stores `object` under `key`, creating the dictionary on the first store; an
// empty `object` removes the key (and does nothing when there is no
// dictionary).
void rc_setUserInfo(platform::Connection& connection, std::any object, const std::string& key);
// The value under `key`, or an empty std::any.
std::any rc_userInfoForKey(const platform::Connection& connection, const std::string& key);

// The connection whose call is being delivered on this thread; nullptr
// outside a delivery.
std::shared_ptr<platform::Connection> rcs_currentConnection();

}  // namespace quorvel
