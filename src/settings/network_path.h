#pragma once
// Whether a folder lies on a network file system, for the warning that the
// configuration prints when the database root is remote. Databases on remote
// storage suffer from slow and unreliable locking and from lost writes when
// the connection drops, so the administrator is told, but the path is used
// all the same.
//
// Pure queries of the kernel's view of the mounts: no state, callable from
// any thread. Failures never escape: a folder whose file system cannot be
// determined counts as local.

#include <cstdint>
#include <string>
#include <string_view>

namespace DB {

// True when the folder, or its nearest existing parent, is on a network
// file system.
bool isNetworkPath(const std::string& folder);

// The classification behind isNetworkPath: fsMagic is statfs's f_type;
// fuseType is the mount's type as /proc/self/mountinfo gives it (for example
// "fuse.sshfs"), consulted only for FUSE mounts, whose f_type is the same
// whatever serves them.
bool isNetworkFileSystem(std::uint64_t fsMagic, std::string_view fuseType);

}  // namespace DB
