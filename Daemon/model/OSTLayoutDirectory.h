#pragma once

#include "files/OSTFileManager.h"
#include "platform/base/OSTError.h"

#include <string>

namespace ost {

/// Makes the directory at `path` and gives the path back, whether or not that worked: the accessors of the layout never
/// fail. A failure is logged with the message, whose arguments are the path and the error, under the name of the
/// calling accessor.
inline std::string OSTMakeLayoutDirectory(std::string path, OSTDirectoryAttributes attributes,
                                          platform::Message<std::string, OSTError> failure) {
    attributes.durable = true; // with what will be put there
    if (const auto made = OSTFileManager::defaultManager().createDirectoryAtURL(path, attributes); !made)
        platform::logError<std::string, OSTError>(failure, path, made.error());
    return path;
}

} // namespace ost
