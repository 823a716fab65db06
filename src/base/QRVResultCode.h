// Every result code a request can end with, in one list.
//
// A request's result is one unsigned 64-bit number under "ReplyError"; 1 is
// success and every other value names a failure. The daemon raises these
// codes and the client explains them, and both read them from this list: a
// new code is added here and nowhere else, with its name, its number, the
// short text that quorvactl prints after the number, and what it means.
//
// The numbers are the wire contract and never change. Errors of other
// domains (errno values in POSIX-domain errors, the general domain's format
// error) are not result codes and have no place here.
#pragma once

#include <cstdint>
#include <span>
#include <string_view>

// X(name, number, text, meaning), in increasing order of number.
#define QRV_RESULT_CODES(X)                                                                                            \
  X(kSuccess, 1, "success",                                                                                            \
    "The request succeeded; every request's result starts here. Inside the daemon the same number is also the "        \
    "failure of a user identity that could not be made (no identity for a persona or a uid).")                         \
  X(kMoveToTmpFailed, 4, "move to /tmp failed", "An item on death row could be neither removed nor moved to /tmp.")    \
  X(kTransientNotRemoved, 5, "transient container could not be removed",                                               \
    "An existing transient container could not be moved to death row to make way for a fresh one.")                    \
  X(kSubdirectoryNotCreated, 6, "default subdirectory not created",                                                    \
    "A container's default subdirectory, or the user-managed assets directory, could not be created or set up.")       \
  X(kStagingNotCreated, 7, "staging directory not created",                                                            \
    "The staging directory of a new container could not be created.")                                                  \
  X(kNotMovedLive, 8, "container not moved live", "A new container could not be moved from staging to its place.")     \
  X(kStagingNotRemoved, 9, "staging directory not removed",                                                            \
    "A staging directory left by a failed creation could not be removed.")                                             \
  X(kUnexpectedPath, 10, "path is not what was expected",                                                              \
    "A path is not what was expected: a directory name that is not a UUID, a container that moved, or a "              \
    "destination outside where it must be.")                                                                           \
  X(kInvalidObject, 11, "invalid object or argument",                                                                  \
    "An identity, class, UUID or other argument object is missing or invalid.")                                        \
  X(kFileUnreadable, 12, "a daemon file could not be read",                                                            \
    "A file of the daemon's own (metadata, data-protection update) could not be read.")                                \
  X(kOldNotMovedAside, 14, "moving the old container aside failed",                                                    \
    "Replacing: the old container could not be moved aside. Also: a removal was asked for with no URL.")               \
  X(kNewNotMovedIntoPlace, 15, "moving the new container into place failed",                                           \
    "Replacing: the new container could not be moved into the old one's place.")                                       \
  X(kMissingIdentifier, 18, "missing identifier or entitlements",                                                      \
    "An identifier (or the entitlements that go with it) is missing.")                                                 \
  X(kNoSuchContainer, 21, "no such container",                                                                         \
    "No container matches the request. An expected outcome, so it is not logged as an error.")                         \
  X(kSameContainer, 22, "same container", "Replacing a container with itself.")                                        \
  X(kDifferentClasses, 23, "different container classes", "Replacing a container with one of another class.")          \
  X(kInfoValueNotFound, 24, "info value not found", "A container's info dictionary has no value for the key.")         \
  X(kDestinationExists, 27, "destination already exists", "The destination of a move already exists.")                 \
  X(kNotDeleted, 28, "container could not be deleted",                                                                 \
    "A container could be neither staged for deletion nor deleted.")                                                   \
  X(kInvalidFileContent, 29, "file content invalid or mismatched",                                                     \
    "A file's content is invalid or does not match what it describes.")                                                \
  X(kFileMissingField, 33, "file missing a field", "A file to be written lacks one of its fields.")                    \
  X(kFileNotWritten, 34, "file not written", "A file of the daemon's could not be written.")                           \
  X(kFileUnreadableOrRollbackFailed, 35, "file unreadable or rollback failed",                                         \
    "A replace journal could not be read, or an interrupted replace could not be rolled back.")                        \
  X(kFileNotMovedOrRemoved, 36, "file not moved or removed", "A file of the daemon's could not be moved or removed.")  \
  X(kInvalidInput, 38, "invalid input",                                                                                \
    "A required argument is missing or malformed, or the arrays of a bulk request differ in length.")                  \
  X(kException, 40, "exception inside the operation",                                                                  \
    "An exception was raised inside the operation. Also: a request that failed without a code of its own, which is "   \
    "an internal error of the daemon.")                                                                                \
  X(kDeathRowMoveFailed, 41, "move to death row failed",                                                               \
    "An item could not be moved to death row, or a user-managed asset could not be removed.")                          \
  X(kCacheRebuildFailed, 43, "container cache: rebuild failed",                                                        \
    "The container cache could not rebuild its map of a class from disk.")                                             \
  X(kCacheInconsistent, 44, "container cache: metadata missing",                                                       \
    "The container cache knew a container whose metadata file is gone; the entry was dropped.")                        \
  X(kCacheAddFailed, 45, "container cache: add failed", "A container could not be added to the container cache.")      \
  X(kCacheRemoveFailed, 46, "container cache: remove failed",                                                          \
    "A container could not be removed from the container cache.")                                                      \
  X(kCacheInvalidURL, 47, "container cache: invalid URL", "A container cache entry has no usable URL.")                \
  X(kNewUUIDMoveFailed, 48, "container not moved to a new UUID",                                                       \
    "A container's directory could not be moved to its new UUID name.")                                                \
  X(kInvalidCommand, 49, "invalid command", "The command number is unknown, retired, or has no handler.")              \
  X(kNotEntitled, 55, "caller not entitled", "The caller is not entitled to the command or to the container.")         \
  X(kListLengthsDiffer, 60, "list lengths differ", "Two lists that must be parallel have different lengths.")          \
  X(kDeviceLocked, 61, "device locked", "The device is locked and the request did not ask to retry.")                  \
  X(kACLsNotStandardized, 63, "access-control lists not standardized",                                                 \
    "The access-control lists of shared content could not be standardized before it was moved.")                       \
  X(kSharedContentNotMoved, 64, "shared content not moved",                                                            \
    "Shared content could not be moved into the system group container.")                                              \
  X(kDatabaseFailed, 66, "database operation failed", "An operation on the code-signing database failed.")             \
  X(kDatabaseNotFound, 67, "database entry not found", "The code-signing database has no row for the identifier.")     \
  X(kDatabaseChangeCount, 68, "database changed-row count unexpected",                                                 \
    "A database statement changed another number of rows than expected.")                                              \
  X(kSuperseded, 69, "superseded by a newer data-protection operation",                                                \
    "A newer data-protection operation for the same container has replaced this one.")                                 \
  X(kUserManagedPathNotFound, 71, "user-managed assets directory not found",                                           \
    "The container has no user-managed assets directory and none was to be created.")                                  \
  X(kAllocationFailed, 73, "database row allocation failed", "An allocation failed while reading a database row.")     \
  X(kInvalidUserIdentityData, 75, "invalid user-identity data", "Stored user-identity property-list data is invalid.") \
  X(kDifferentUserIdentities, 76, "different user identities",                                                         \
    "Replacing a container with one of another user identity.")                                                        \
  X(kQueueExhausted, 77, "command queue exhausted",                                                                    \
    "Internal: a request's command queue ran dry. Never sent to a client.")

namespace QRVResultCode {

// Unscoped so that a code converts to the wire's uint64_t where it is stored
// ("*result = QRVResultCode::kNotEntitled").
enum Code : uint64_t {
#define QRV_RESULT_CODE_ENUMERATOR(name, number, text, meaning) name = number,
  QRV_RESULT_CODES(QRV_RESULT_CODE_ENUMERATOR)
#undef QRV_RESULT_CODE_ENUMERATOR
};

// Formats as its number in log lines.
constexpr uint64_t format_as(Code code) { return code; }

struct Entry {
  Code code;
  std::string_view name;     // "kNoSuchContainer"
  std::string_view text;     // "no such container"
  std::string_view meaning;  // a sentence or two
};

// The list, in increasing order of number.
std::span<const Entry> all();

// The entry of `code`, or null for a number outside the list (a daemon newer
// than the client may answer one; print the number).
const Entry* find(uint64_t code);

// The entry's short text, or an empty view for a number outside the list.
std::string_view text(uint64_t code);

}  // namespace QRVResultCode
