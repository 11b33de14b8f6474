// The two ways of opening a path beneath a directory; openBeneath
// (platform/file_system.h) takes the first the system allows.
#pragma once

namespace kestrel::platform {

// openat2 with RESOLVE_BENEATH | RESOLVE_NO_MAGICLINKS | RESOLVE_NO_XDEV;
// ENOSYS where the kernel or a system-call filter refuses it.
int openBeneathWithOpenat2(int baseFd, const char* relativePath, int flags, int* fd);

// One name at a time from baseFd: each directory opened relative to the one
// before without following links (a link anywhere on the path is ELOOP, even
// one that stays beneath), ".." refused (EXDEV), and every step checked to be
// on baseFd's mount (EXDEV otherwise). Stricter than openat2, never looser.
int openBeneathByNames(int baseFd, const char* relativePath, int flags, int* fd);

}  // namespace kestrel::platform
