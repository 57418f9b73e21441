#pragma once

namespace rolvane {

// Property names of records, as they stand in dictionaries, payloads and stored blobs.

// Kept by the database itself; read with valueForProperty, never part of dictionaryRepresentation.
inline constexpr const char* kCXUIDProperty = "UID";                           // string: the unique identifier
inline constexpr const char* kCXCreationDateProperty = "CreationDate";         // date
inline constexpr const char* kCXModificationDateProperty = "ModificationDate"; // date: of the save, in microseconds

// Any record.
inline constexpr const char* kCXRemoteLocationProperty = "RemoteLocation";           // multi-value of location strings
inline constexpr const char* kCXReadSharingACLProperty = "ReadSharingACL";           // multi-value of principals
inline constexpr const char* kCXReadWriteSharingACLProperty = "ReadWriteSharingACL"; // multi-value of principals
inline constexpr const char* kCXNoteProperty = "Note";                               // string
inline constexpr const char* kCXVCardExtraProperty = "VCardExtra"; // array of strings: content lines not understood

// Groups.
inline constexpr const char* kCXGroupNameProperty = "GroupName"; // string, never missing, never empty

// People: single strings.
inline constexpr const char* kCXFirstNameProperty = "First";
inline constexpr const char* kCXLastNameProperty = "Last";
inline constexpr const char* kCXMiddleNameProperty = "Middle";
inline constexpr const char* kCXTitleProperty = "Title";
inline constexpr const char* kCXSuffixProperty = "Suffix";
inline constexpr const char* kCXNicknameProperty = "Nickname";
inline constexpr const char* kCXMaidenNameProperty = "MaidenName";
inline constexpr const char* kCXFirstNamePhoneticProperty = "FirstPhonetic";
inline constexpr const char* kCXMiddleNamePhoneticProperty = "MiddlePhonetic";
inline constexpr const char* kCXLastNamePhoneticProperty = "LastPhonetic";
inline constexpr const char* kCXFormattedNameProperty = "FormattedName"; // only where it differs from the parts
inline constexpr const char* kCXOrganizationProperty = "Organization";
inline constexpr const char* kCXDepartmentProperty = "Department";
inline constexpr const char* kCXJobTitleProperty = "JobTitle";
inline constexpr const char* kCXHomePageProperty = "HomePage";
// People: others.
inline constexpr const char* kCXBirthdayProperty = "Birthday";         // date
inline constexpr const char* kCXBirthdayTextProperty = "BirthdayText"; // string: a birthday that is no full date
inline constexpr const char* kCXPhotoProperty = "Photo";               // data
inline constexpr const char* kCXPhotoTypeProperty = "PhotoType";       // string: media type of the photo
inline constexpr const char* kCXIsCompanyProperty = "IsCompany";       // boolean
inline constexpr const char* kCXCategoriesProperty = "Categories";     // array of strings
// People: multi-values.
inline constexpr const char* kCXPhoneProperty = "Phone";                   // of strings
inline constexpr const char* kCXEmailProperty = "Email";                   // of strings
inline constexpr const char* kCXAddressProperty = "Address";               // of dictionaries (keys below)
inline constexpr const char* kCXURLsProperty = "URLs";                     // of strings
inline constexpr const char* kCXInstantMessageProperty = "InstantMessage"; // of strings (URIs) or dictionaries
inline constexpr const char* kCXRelatedNamesProperty = "RelatedNames";     // of strings
inline constexpr const char* kCXOtherDatesProperty = "OtherDates";         // of dates

// Keys of an address.
inline constexpr const char* kCXAddressStreetKey = "Street";
inline constexpr const char* kCXAddressExtendedKey = "Extended";
inline constexpr const char* kCXAddressPOBoxKey = "POBox";
inline constexpr const char* kCXAddressCityKey = "City";
inline constexpr const char* kCXAddressStateKey = "State";
inline constexpr const char* kCXAddressZIPKey = "ZIP";
inline constexpr const char* kCXAddressCountryKey = "Country";
inline constexpr const char* kCXAddressCountryCodeKey = "CountryCode";

// Subscriptions (kCXRemoteLocationProperty is a plain string there).
inline constexpr const char* kCXSubscriptionIsAllProperty = "IsAll"; // boolean
inline constexpr const char* kCXSubscriptionNameProperty = "Name";   // string: what a person calls it
inline constexpr const char* kCXLocalRemoteLocation = "local";       // the built-in subscription's location

// Labels of multi-value entries. The first two say what a remote location is for.
inline constexpr const char* kCXPublishLabel = "Publish";
inline constexpr const char* kCXSubscribeLabel = "Subscribe";
inline constexpr const char* kCXHomeLabel = "Home";
inline constexpr const char* kCXWorkLabel = "Work";
inline constexpr const char* kCXMobileLabel = "Mobile";
inline constexpr const char* kCXMainLabel = "Main";
inline constexpr const char* kCXHomeFaxLabel = "HomeFax";
inline constexpr const char* kCXWorkFaxLabel = "WorkFax";
inline constexpr const char* kCXPagerLabel = "Pager";
inline constexpr const char* kCXHomePageLabel = "HomePage";
inline constexpr const char* kCXAnniversaryLabel = "Anniversary";
inline constexpr const char* kCXOtherLabel = "Other";

// Posted in this process when other processes have saved: once per waking, every waiting save joined, none split.
inline constexpr const char* kCXDatabaseChangedExternallyNotificationPriv =
    "CXDatabaseChangedExternallyNotificationPriv";
inline constexpr const char* kCXInsertedRecords = "CXInsertedRecords"; // array of unique identifiers, may be absent
inline constexpr const char* kCXUpdatedRecords = "CXUpdatedRecords";   // the same
inline constexpr const char* kCXDeletedRecords = "CXDeletedRecords";   // the same
inline constexpr const char* kCXSenderProcessID = "CXSenderProcessID"; // integer; of the latest save when joined

// Sent to the other processes of the user after each save that changed a record.
inline constexpr const char* kCXDatabaseChangedDistributedNotification = "CXDatabaseChanged";
inline constexpr const char* kCXDatabasePathKey = "path";         // string
inline constexpr const char* kCXDatabaseIdentityKey = "identity"; // string

// Comparisons of search elements. Numbers and dates by value, strings by byte order; the last two fold ASCII case.
enum CXSearchComparison : int {
    kCXEqual = 0,
    kCXNotEqual = 1,
    kCXLessThan = 2,
    kCXLessThanOrEqual = 3,
    kCXGreaterThan = 4,
    kCXGreaterThanOrEqual = 5,
    kCXEqualCaseInsensitive = 6,
    kCXContainsSubStringCaseInsensitive = 7,
};

} // namespace rolvane
