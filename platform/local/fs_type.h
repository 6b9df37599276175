// The numbers that KAVOGetFSType() gives. Not installed.
#ifndef PLATFORM_LOCAL_FS_TYPE_H_
#define PLATFORM_LOCAL_FS_TYPE_H_

#include <cstdint>
#include <string_view>

namespace kavo::local {

enum FsType : int {
  kOrdinaryFs = 0,
  // What another machine serves.
  kNfs = 1,
  kSmb = 2,
  kAfs = 3,
  k9p = 4,
  kCeph = 5,
  kCoda = 6,
  kNcp = 7,
  kClusterFs = 8,  // Lustre, BeeGFS, GPFS, OrangeFS
  kHostShare = 9,  // Of the machine that this one is a guest of.
  kRemoteFuse = 10,
  // 12 stays free: callers refuse that number whatever it stands for.
  // What is read from an image.
  kIso9660 = 20,
  kUdf = 21,
  kSquashfs = 22,
  kCramfs = 23,
  kErofs = 24,
  kImageFuse = 25,
};

// By the number that statfs() gives. FUSE's is kOrdinaryFs, as it does not tell who serves it.
FsType TypeOfMagic(uint32_t magic);

// Of a mount that FUSE serves, by its type ("fuse.sshfs", "fuse", "fuseblk", "virtiofs") and
// source in the list of mounts. One that is not known by name is remote when its source reads
// "host:/path" or "scheme://...", and ordinary otherwise.
FsType TypeOfFuse(std::string_view type, std::string_view source);

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_FS_TYPE_H_
