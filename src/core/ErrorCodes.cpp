#include "core/ErrorCodes.h"

namespace berth {

std::string_view BTHErrorCodeName(uint64_t code) {
    switch (code) {
#define BTH_CODE_NAME(name) \
    case name:              \
        return #name;
        BTH_CODE_NAME(BTHErrorSuccess)
        BTH_CODE_NAME(BTHErrorMoveAsideFailed)
        BTH_CODE_NAME(BTHErrorRemoveTransientFailed)
        BTH_CODE_NAME(BTHErrorDirectorySetupFailed)
        BTH_CODE_NAME(BTHErrorCreateStagingFailed)
        BTH_CODE_NAME(BTHErrorMoveStagingFailed)
        BTH_CODE_NAME(BTHErrorRemoveStagingFailed)
        BTH_CODE_NAME(BTHErrorInvalidPath)
        BTH_CODE_NAME(BTHErrorInvalidArgument)
        BTH_CODE_NAME(BTHErrorMetadataReadFailed)
        BTH_CODE_NAME(BTHErrorMoveToStagingFailed)
        BTH_CODE_NAME(BTHErrorReplaceFailed)
        BTH_CODE_NAME(BTHErrorDestroyFailed)
        BTH_CODE_NAME(BTHErrorIdentifierMissing)
        BTH_CODE_NAME(BTHErrorNotFound)
        BTH_CODE_NAME(BTHErrorReplaceSameContainer)
        BTH_CODE_NAME(BTHErrorReplaceClassMismatch)
        BTH_CODE_NAME(BTHErrorInfoValueNotFound)
        BTH_CODE_NAME(BTHErrorAlreadyExists)
        BTH_CODE_NAME(BTHErrorDeleteFailed)
        BTH_CODE_NAME(BTHErrorMetadataInvalid)
        BTH_CODE_NAME(BTHErrorReplaceInfoInvalid)
        BTH_CODE_NAME(BTHErrorWriteFailed)
        BTH_CODE_NAME(BTHErrorReplaceJournalFailed)
        BTH_CODE_NAME(BTHErrorCleanupFailed)
        BTH_CODE_NAME(BTHErrorInvalidParameter)
        BTH_CODE_NAME(BTHErrorException)
        BTH_CODE_NAME(BTHErrorMoveToDeathRowFailed)
        BTH_CODE_NAME(BTHErrorCacheRebuildFailed)
        BTH_CODE_NAME(BTHErrorCacheInconsistent)
        BTH_CODE_NAME(BTHErrorCacheAddFailed)
        BTH_CODE_NAME(BTHErrorCacheRemoveFailed)
        BTH_CODE_NAME(BTHErrorCacheInvalidInput)
        BTH_CODE_NAME(BTHErrorRegenerateMoveFailed)
        BTH_CODE_NAME(BTHErrorInvalidCommand)
        BTH_CODE_NAME(BTHErrorNotEntitled)
        BTH_CODE_NAME(BTHErrorReplaceUserMismatch)
        BTH_CODE_NAME(BTHErrorMappingWriteFailed)
        BTH_CODE_NAME(BTHErrorMappingInvalidInput)
        BTH_CODE_NAME(BTHErrorDeviceLocked)
        BTH_CODE_NAME(BTHErrorChangeOwnerFailed)
        BTH_CODE_NAME(BTHErrorACLFailed)
        BTH_CODE_NAME(BTHErrorStageSharedContentFailed)
#undef BTH_CODE_NAME
        default:
            return {};
    }
}

}  // namespace berth
