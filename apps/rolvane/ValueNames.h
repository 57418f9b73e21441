#pragma once

namespace rolvane::cli {

// The kinds of values that an argument or an option can have, by the names that --help shows for them:
// `command.add_option(...)->type_name(kGroupValue)`. Completion knows which values there are of each
// (CompletionValues.h). A value of any other kind is not completed, but for one of a set (CLI::IsMember).
inline constexpr const char* kFileValue = "FILE";
inline constexpr const char* kDirectoryValue = "DIRECTORY";
inline constexpr const char* kPersonValue = "PERSON"; // a contact
inline constexpr const char* kGroupValue = "GROUP";
inline constexpr const char* kUserValue = "USER";            // of the store: all who are known here
inline constexpr const char* kReaderValue = "READER";        // a user with whom the owner shares
inline constexpr const char* kPublisherValue = "PUBLISHER";  // a user to whom the owner subscribes
inline constexpr const char* kStoreUserValue = "STORE-USER"; // of the private store that --directory names
inline constexpr const char* kDeviceValue = "DEVICE";        // of the address books that --directory names
inline constexpr const char* kWithdrawnValue = "WITHDRAWN";  // contacts that a publisher no longer shares
inline constexpr const char* kConflictValue = "CONFLICT";    // the number of one
inline constexpr const char* kComputerValue = "COMPUTER";    // another one that keeps the own contacts in step
inline constexpr const char* kKeyValue = "KEY";              // of the preferences that --domain names

} // namespace rolvane::cli
