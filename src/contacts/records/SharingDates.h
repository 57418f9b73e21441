#pragma once

namespace rolvane {

// Beside the owner's two lists of an all-contacts group: since when each of their users is on them. Multi-values of
// dates with the users as labels. A user who was put on a list by a program that notes no date is missing.
inline constexpr const char* kCXReadSharingDatesProperty = "ReadSharingDates";
inline constexpr const char* kCXReadWriteSharingDatesProperty = "ReadWriteSharingDates";

} // namespace rolvane
