#include "common/place.h"

#include <fcntl.h>

#include <cerrno>
#include <system_error>

namespace platform {

Place::Place(const std::string& path) : path_(path), name_(path.substr(path.rfind('/') + 1)) {
  folder_ = Descriptor(open(folder_path().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!folder_) throw std::system_error(errno, std::generic_category(), "cannot open the folder of " + path);
}

std::string Place::folder_path() const {
  const std::size_t slash = path_.rfind('/');
  if (slash == std::string::npos) return ".";
  return path_.substr(0, slash + 1);
}

std::optional<struct stat> Place::found(const std::string& suffix) const {
  struct stat file {};
  if (fstatat(folder_.get(), (name_ + suffix).c_str(), &file, AT_SYMLINK_NOFOLLOW) != 0) return std::nullopt;
  return file;
}

bool Place::leads_here() const {
  struct stat there {};
  if (stat(folder_path().c_str(), &there) != 0) return false;
  return same_file(there, file_of(folder_.get()));
}

std::string Place::path_by_descriptor() const {
  return "/proc/self/fd/" + std::to_string(folder_.get()) + "/" + name_;
}

std::string Place::danger(mode_t writers) const {
  const auto folder = file_of(folder_.get());
  if (!folder) return "cannot look at the folder of " + path_;
  if (folder->st_uid != 0 && folder->st_uid != geteuid()) {
    return "the folder of " + path_ + " belongs to user " + std::to_string(folder->st_uid) +
           ", who could exchange it: choose a folder of root's or of this daemon's user";
  }
  if ((folder->st_mode & writers) == 0 || (folder->st_mode & S_ISVTX) != 0) return {};
  return "the folder of " + path_ +
         " can be written by others, who could exchange it: take their right away (chmod go-w), or set its sticky "
         "bit (chmod +t)";
}

bool same_file(const std::optional<struct stat>& one, const std::optional<struct stat>& other) {
  if (!one || !other) return !one && !other;
  return one->st_dev == other->st_dev && one->st_ino == other->st_ino;
}

std::optional<struct stat> file_of(int fd) {
  struct stat file {};
  if (fstat(fd, &file) != 0) return std::nullopt;
  return file;
}

}  // namespace platform
