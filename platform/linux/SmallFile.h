#pragma once

#include <cstddef>
#include <string>

#include "platform/Outcome.h"

namespace ostrel {

enum class FileLinks { kFollow, kRefuse };

/// The whole of a regular file of at most `mostBytes`. Anything else that stands
/// under the name (a pipe, a device, a directory, a larger file) is an error of the
/// domain "POSIX" and is never waited for.
Outcome<std::string> readSmallFile(const std::string& path, std::size_t mostBytes,
                                   FileLinks links);

/// `errno` in the domain "POSIX", as a sentence about `path`.
ErrorObject errorOfPath(int error, const std::string& path);

}  // namespace ostrel
