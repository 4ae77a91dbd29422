// What the replica's file says about the account, and how joining or changing it changes the file; no I/O.
//
// Beside "values" the file holds "device", this device's name in the account; "account", once that has been
// downloaded; "writers", the identities of this device's own publishing processes, whose documents may still
// be found; "reason" and "reasonSequence" for those who load the file.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/Stores.hpp"
#include "platform/Value.hpp"

namespace cloudsync {

// The account that the replica belongs to; absent for a device on its own.
std::optional<std::string> accountOf(const platform::Dictionary& replica);

bool isOwnWriter(const platform::Dictionary& replica, const std::string& writer);
// Before it publishes, or its own document would be a stranger's after a crash.
void addWriter(platform::Dictionary& replica, const std::string& writer);

// Tells those who load the file a reason, once.
void giveReason(platform::Dictionary& replica, platform::CloudStore::ChangeReason reason);

// The first download of an account. What was downloaded holds, whatever was written here, and when; a local
// entry stays where the account has neither its key nor the key's companion, or the flag of one device and
// the end time of another would mix.
void join(platform::Dictionary& replica, const std::string& account, const platform::Dictionary& downloaded);

// Another account takes the place of the one there was: nothing of the old one stays.
void changeAccount(platform::Dictionary& replica, const std::string& account,
                   const platform::Dictionary& downloaded);

// The device is a copy of another's disk: from now on it is one of its own.
void makeNewIdentity(platform::Dictionary& replica);

// The keys of which `entries` has something that the union of all documents lacks; sorted.
std::vector<std::string> newsIn(const platform::Dictionary& entries, const platform::Dictionary& documents,
                                platform::Time now);

}  // namespace cloudsync
