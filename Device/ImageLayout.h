#pragma once

#include "Protocol/OSTServices.h"
#include "Protocol/OSTUserId.h"

#include <array>
#include <string_view>

namespace ost::device {

// What a directory needs to be a device image. Packages make it from the same tables.

/// The user of the account "mobile".
inline constexpr unsigned mobileUser = 501;

struct ImageDirectory {
    const char* name;
    unsigned mode;
    unsigned owner; ///< and group
};

/// Where the sockets are; it is empty when a device boots. Paths in an image begin at its root.
inline constexpr const char* runDirectory = OSTServiceSocketDirectory + 1;

// Parents first. The staging area and death row lie in root's home: users may not pass it. The other homes are open,
// because the containers in them have modes of their own, and bundles are for everybody.
inline constexpr std::array imageDirectories{
    ImageDirectory{"dev", 0755, OSTRootUserId},
    ImageDirectory{"dev/shm", 0755, OSTRootUserId},
    ImageDirectory{"etc", 0755, OSTRootUserId},
    ImageDirectory{"private", 0755, OSTRootUserId},
    ImageDirectory{"private/var", 0755, OSTRootUserId},
    ImageDirectory{"private/var/db", 0755, OSTRootUserId},
    ImageDirectory{"private/var/mobile", 0755, mobileUser},
    ImageDirectory{"private/var/root", 0700, OSTRootUserId},
    ImageDirectory{runDirectory, 0755, OSTRootUserId},
    ImageDirectory{"private/var/tessalyd", 0755, OSTInstallerUserId},
    ImageDirectory{"proc", 0555, OSTRootUserId},
    ImageDirectory{"tmp", 01777, OSTRootUserId},
};

struct ImageFile {
    const char* name;
    std::string_view content;
};

inline constexpr const char* accountFile = "etc/passwd";

// The accounts come last: they are what makes a directory an image, so an interrupted making starts again.
inline constexpr std::array imageFiles{
    ImageFile{"etc/os-release", "NAME=\"Ostrand device\"\nID=ostrand\nVERSION_ID=1\nBUILD_ID=1A1\n"},
    ImageFile{"etc/group", "root:x:0:\ntessalyd:x:33:\nsystem:x:499:\nsystemusers:x:500:system\nmobile:x:501:\n"},
    ImageFile{accountFile, "root:x:0:0:Administrator:/private/var/root:/bin/sh\n"
                           "tessalyd:x:33:33:Installer:/private/var/tessalyd:/bin/false\n"
                           "system:x:499:499:System services:/private/var/empty:/bin/false\n"
                           "mobile:x:501:501:Mobile user:/private/var/mobile:/bin/sh\n"},
};

} // namespace ost::device
