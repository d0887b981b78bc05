#include "files/OSTFileManager.h"
#include "files/OSTTreeWalk.h"
#include "platform/base/Log.h"

#include <cstring>

namespace ost {

using platform::logError;

void OSTFileManager::printDirectoryStructureAtURL(std::string_view path, std::size_t maximumLines) const {
    std::size_t lines = 0;
    OSTWalkTree(path, [&](const OSTTreeEntry& entry) {
        const bool failed = entry.visit == OSTTreeEntry::Visit::failure;
        if (entry.visit == OSTTreeEntry::Visit::directoryAfter)
            return true;
        if (lines == maximumLines)
            logError("\tOrphaned File: only the first %llu items are listed", maximumLines);
        else if (failed && lines == 0)
            logError("fts_open failed for %@ : %s", path, entry.error);
        else if (failed)
            logError("FTS returned error for %s : %s", entry.path, entry.error);
        else
            logError("\tOrphaned File: %s", entry.path);
        return lines++ < maximumLines;
    });
}

} // namespace ost
