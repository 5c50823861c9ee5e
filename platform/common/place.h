// Where a file or a socket lies: calls by path would follow whatever others have put on the way meanwhile.
#pragma once

#include <sys/stat.h>

#include <optional>
#include <string>

#include "common/descriptor.h"

namespace platform {

/// A folder, held open so that nobody can put another in its place, and a name in it.
class Place {
 public:
  /// Throws std::system_error: there is no such folder.
  explicit Place(const std::string& path);

  const std::string& path() const { return path_; }
  const std::string& name() const { return name_; }
  int folder() const { return folder_.get(); }

  /// What bears the name, with `suffix` behind it, now: a link itself, not what it leads to. Nothing: nothing
  /// does.
  std::optional<struct stat> found(const std::string& suffix = "") const;
  /// False: by now the path leads into another folder, or none.
  bool leads_here() const;
  /// Of the name, for calls that take no descriptor of a folder.
  std::string path_by_descriptor() const;
  /// Why somebody other than root and this process's user can exchange what lies in the folder, and what to do;
  /// empty: nobody can. `writers`: who must not write there, S_IWGRP or S_IWOTH.
  std::string danger(mode_t writers) const;

 private:
  std::string folder_path() const;

  std::string path_;
  std::string name_;
  Descriptor folder_;
};

/// The same file, or no file both times.
bool same_file(const std::optional<struct stat>& one, const std::optional<struct stat>& other);

/// Nothing: not open.
std::optional<struct stat> file_of(int fd);

}  // namespace platform
