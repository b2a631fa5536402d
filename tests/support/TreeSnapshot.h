#pragma once

#include <map>
#include <string>

namespace cindral::test {

/// What lies below a folder: for each path below it, the kind and mode, and the contents, target or attributes.
///
/// Times of files are part of it, those of folders are not: they tell what was tried. The temporary folder's own
/// comings and goings are left out where `withTemporary` says so.
using TreeSnapshot = std::map<std::string, std::string>;
TreeSnapshot snapshotOf(const std::string& folder, bool withTemporary = false);

}  // namespace cindral::test
