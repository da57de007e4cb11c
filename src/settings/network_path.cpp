#include "settings/network_path.h"

#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/sysmacros.h>

#include <array>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <sstream>

namespace DB {
namespace {

// File systems whose data lives on another machine. The magic numbers are
// the kernel's (linux/magic.h) except Lustre's, which its client defines:
//   NFS (v2 to v4)            0x6969
//   SMB (old smbfs)           0x517B
//   CIFS / SMB2 / SMB3        0xFF534D42, 0xFE534D42 (the SMB PDU signatures)
//   AFS (OpenAFS), kAFS       0x5346414F, 0x6B414653
//   Coda                      0x73757245
//   NCP (NetWare)             0x564C
//   9P (virtio and network)   0x01021997
//   Ceph kernel client        0x00C36400
//   Lustre                    0x0BD00BD0
// Cluster file systems on shared block devices (OCFS2, GFS2) are left out:
// their storage is local to the node and their locking is sound.
constexpr std::uint64_t kLustreSuperMagic = 0x0BD00BD0;
constexpr std::array<std::uint64_t, 11> kNetworkMagics = {
    NFS_SUPER_MAGIC,  SMB_SUPER_MAGIC, CIFS_SUPER_MAGIC, SMB2_SUPER_MAGIC, AFS_SUPER_MAGIC,  AFS_FS_MAGIC,
    CODA_SUPER_MAGIC, NCP_SUPER_MAGIC, V9FS_MAGIC,       CEPH_SUPER_MAGIC, kLustreSuperMagic};

// FUSE serves local disks (ntfs-3g, exfat) as well as remote ones, so a FUSE
// mount counts as remote only when its type names a known network client.
constexpr std::array<std::string_view, 8> kNetworkFuseTypes = {"fuse.sshfs",     "fuse.rclone",    "fuse.s3fs",
                                                               "fuse.glusterfs", "fuse.ceph-fuse", "fuse.curlftpfs",
                                                               "fuse.smbnetfs",  "fuse.gcsfuse"};

// The mount type of the device, from /proc/self/mountinfo; "" if not found.
// A line reads: id parent major:minor root mountpoint options... - type source
std::string mountType(dev_t device) {
  std::ifstream in("/proc/self/mountinfo");
  const std::string wanted = std::to_string(major(device)) + ":" + std::to_string(minor(device));
  std::string line;
  while (std::getline(in, line)) {
    std::istringstream fields(line);
    std::string id, parent, dev;
    if (!(fields >> id >> parent >> dev) || dev != wanted) continue;
    const auto separator = line.find(" - ");
    if (separator == std::string::npos) continue;
    std::istringstream tail(line.substr(separator + 3));
    std::string type;
    if (tail >> type) return type;
  }
  return {};
}

}  // namespace

bool isNetworkFileSystem(std::uint64_t fsMagic, std::string_view fuseType) {
  for (const auto magic : kNetworkMagics) {
    if (fsMagic == magic) return true;
  }
  if (fsMagic != FUSE_SUPER_MAGIC) return false;
  for (const auto type : kNetworkFuseTypes) {
    if (fuseType == type) return true;
  }
  return false;
}

bool isNetworkPath(const std::string& folder) {
  try {
    // The root may not exist yet (it is created when the first database is);
    // its nearest existing parent then decides where it will live.
    std::filesystem::path p = std::filesystem::absolute(folder).lexically_normal();
    while (true) {
      struct statfs fs {};
      if (::statfs(p.c_str(), &fs) == 0) {
        const auto magic = static_cast<std::uint64_t>(fs.f_type);
        std::string fuseType;
        if (magic == FUSE_SUPER_MAGIC) {
          struct stat st {};
          if (::stat(p.c_str(), &st) == 0) fuseType = mountType(st.st_dev);
        }
        return isNetworkFileSystem(magic, fuseType);
      }
      if (errno != ENOENT && errno != ENOTDIR) return false;
      // lexically_normal leaves a trailing "/" as an empty last element.
      const auto parent = p.has_filename() ? p.parent_path() : p.parent_path().parent_path();
      if (parent.empty() || parent == p) return false;
      p = parent;
    }
  } catch (const std::exception&) {
    return false;
  }
}

}  // namespace DB
