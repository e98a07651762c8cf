#include "quorveld/RCSAdditions.h"

namespace quorvel {

bool rcs_isValid(const platform::Connection& connection) { return connection.isValid(); }

void rcs_setValid(platform::Connection& connection, bool valid) { connection.setValid(valid); }

void rc_setUserInfo(platform::Connection& connection, std::any object, const std::string& key) {
  connection.setUserInfo(key, std::move(object));
}

std::any rc_userInfoForKey(const platform::Connection& connection, const std::string& key) {
  return connection.userInfo(key);
}

std::shared_ptr<platform::Connection> rcs_currentConnection() {
  return platform::Connection::current();
}

}  // namespace quorvel
