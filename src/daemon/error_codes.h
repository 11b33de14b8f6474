// The daemon's error codes (domain "KSTErrorDomain"). 1 is success and the value
// every request's code starts with; numbers missing from the list are reserved.
#pragma once

#include <cstdint>

namespace kestrel {

enum KSTErrorCode : std::uint64_t {
  kKSTSuccess = 1,
  kKSTErrorMoveToTempFailed = 4,
  kKSTErrorRemoveTransientFailed = 5,
  kKSTErrorCreateSubdirectoryFailed = 6,
  kKSTErrorCreateStagingFailed = 7,
  kKSTErrorMoveStagingFailed = 8,
  kKSTErrorRemoveStagingFailed = 9,
  kKSTErrorInvalidURL = 10,
  kKSTErrorInvalidObject = 11,
  kKSTErrorMetadataReadFailed = 12,
  kKSTErrorReplaceStagingFailed = 14,
  kKSTErrorReplaceFailed = 15,
  kKSTErrorDestroyFailed = 17,
  kKSTErrorMissingIdentifier = 18,
  kKSTErrorNotFound = 21,
  kKSTErrorReplaceSameContainer = 22,
  kKSTErrorClassMismatch = 23,
  kKSTErrorInfoValueNotFound = 24,
  kKSTErrorAlreadyExists = 27,
  kKSTErrorDeleteFailed = 28,
  kKSTErrorInvalidMetadata = 29,
  kKSTErrorInvalidReplaceInfo = 33,
  kKSTErrorWriteFailed = 34,
  kKSTErrorReplaceRecoveryFailed = 35,
  kKSTErrorReplaceCleanupFailed = 36,
  kKSTErrorInvalidParameter = 38,
  kKSTErrorException = 40,
  kKSTErrorDeathRowMoveFailed = 41,
  kKSTErrorCacheRebuildFailed = 43,
  kKSTErrorCacheInconsistent = 44,
  kKSTErrorCacheAddFailed = 45,
  kKSTErrorCacheRemoveFailed = 46,
  kKSTErrorCacheInvalidInput = 47,
  kKSTErrorRegenerateUUIDFailed = 48,
  kKSTErrorInvalidCommand = 49,
  kKSTErrorNotEntitled = 55,
  kKSTErrorUserMismatch = 56,
  kKSTErrorMappingWriteFailed = 59,
  kKSTErrorMappingInvalidInput = 60,
  kKSTErrorDeviceLocked = 61,
  kKSTErrorChangeOwnerFailed = 62,
  kKSTErrorACLFailed = 63,
  kKSTErrorSharedContentMoveFailed = 64,
};

}  // namespace kestrel
