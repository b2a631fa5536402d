#pragma once

#ifdef __cplusplus
extern "C" {
#endif

/* What the kernel charges for a listing: getdents64, and for each entry statx, llistxattr and faccessat for writing; for each sub-folder one
   more getdents64. With `descend`, the entries of the sub-folders too. Answers the number of entries, or -1. */
long floor_list(const char* folder, int descend);

#ifdef __cplusplus
}
#endif
