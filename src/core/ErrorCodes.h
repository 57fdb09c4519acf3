// The error numbering shared by the daemon's error objects, every withError
// code and every "ReplyError". 1 means success; codes not listed are unused.
#pragma once

#include <cstdint>
#include <string_view>

namespace berth {

enum BTHErrorCode : int32_t {
    BTHErrorSuccess = 1,
    BTHErrorMoveAsideFailed = 4,
    BTHErrorRemoveTransientFailed = 5,
    BTHErrorDirectorySetupFailed = 6,
    BTHErrorCreateStagingFailed = 7,
    BTHErrorMoveStagingFailed = 8,
    BTHErrorRemoveStagingFailed = 9,
    BTHErrorInvalidPath = 10,
    BTHErrorInvalidArgument = 11,
    BTHErrorMetadataReadFailed = 12,
    BTHErrorMoveToStagingFailed = 14,
    BTHErrorReplaceFailed = 15,
    BTHErrorDestroyFailed = 17,
    BTHErrorIdentifierMissing = 18,
    BTHErrorNotFound = 21,
    BTHErrorReplaceSameContainer = 22,
    BTHErrorReplaceClassMismatch = 23,
    BTHErrorInfoValueNotFound = 24,
    BTHErrorAlreadyExists = 27,
    BTHErrorDeleteFailed = 28,
    BTHErrorMetadataInvalid = 29,
    BTHErrorReplaceInfoInvalid = 33,
    BTHErrorWriteFailed = 34,
    BTHErrorReplaceJournalFailed = 35,
    BTHErrorCleanupFailed = 36,
    BTHErrorInvalidParameter = 38,
    BTHErrorException = 40,
    BTHErrorMoveToDeathRowFailed = 41,
    BTHErrorCacheRebuildFailed = 43,
    BTHErrorCacheInconsistent = 44,
    BTHErrorCacheAddFailed = 45,
    BTHErrorCacheRemoveFailed = 46,
    BTHErrorCacheInvalidInput = 47,
    BTHErrorRegenerateMoveFailed = 48,
    BTHErrorInvalidCommand = 49,
    BTHErrorNotEntitled = 55,
    BTHErrorReplaceUserMismatch = 56,
    BTHErrorMappingWriteFailed = 59,
    BTHErrorMappingInvalidInput = 60,
    BTHErrorDeviceLocked = 61,
    BTHErrorChangeOwnerFailed = 62,
    BTHErrorACLFailed = 63,
    BTHErrorStageSharedContentFailed = 64,
};

// The name of a code of the table ("BTHErrorNotFound"), or an empty view for
// a number the table does not use.
std::string_view BTHErrorCodeName(uint64_t code);

}  // namespace berth
