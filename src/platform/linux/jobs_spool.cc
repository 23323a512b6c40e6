#include "platform/linux/jobs_spool.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>
#include <memory>

#include "base/unique_fd.h"

namespace brisvale::jobs {
namespace {

constexpr size_t kMaxSpooledJobBytes = 1 << 20;

LaunchError SystemError(const char* what, int error) {
  return LaunchError{std::string(what) + ": " + std::strerror(error)};
}

// mkdir -p with mode 0755; 0 or -errno.
int MakeDirectories(const std::string& path) {
  for (size_t slash = path.find('/', 1);; slash = path.find('/', slash + 1)) {
    const std::string part = path.substr(0, slash);
    if (!part.empty() && ::mkdir(part.c_str(), 0755) != 0 && errno != EEXIST) return -errno;
    if (slash == std::string::npos) return 0;
  }
}

bool WriteAll(int fd, const plist::Bytes& bytes) {
  size_t written = 0;
  while (written < bytes.size()) {
    const ssize_t n = ::write(fd, bytes.data() + written, bytes.size() - written);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    written += static_cast<size_t>(n);
  }
  return true;
}

// A file created under a fresh hidden name; removed when it goes unless Keep() was
// called after it got its real name.
class TemporaryFile {
 public:
  explicit TemporaryFile(int dirFd) : dirFd_(dirFd) {
    for (int attempt = 0; attempt < 16 && !fd_; ++attempt) {
      uint64_t nonce = 0;
      if (::getrandom(&nonce, sizeof nonce, 0) != sizeof nonce) continue;
      char name[40];
      std::snprintf(name, sizeof name, ".submit-%016llx", static_cast<unsigned long long>(nonce));
      fd_.Reset(::openat(dirFd, name, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
      if (fd_) name_ = name;
      else if (errno != EEXIST) break;
    }
    if (!fd_) error_ = errno;
  }
  ~TemporaryFile() {
    if (!name_.empty()) ::unlinkat(dirFd_, name_.c_str(), 0);
  }
  TemporaryFile(const TemporaryFile&) = delete;
  TemporaryFile& operator=(const TemporaryFile&) = delete;

  int fd() const { return fd_.get(); }
  int error() const { return error_; }
  const std::string& name() const { return name_; }
  void Keep() { name_.clear(); }

 private:
  int dirFd_;
  UniqueFd fd_;
  std::string name_;
  int error_ = 0;
};

std::optional<plist::Dictionary> ReadSpoolFile(int dirFd, const char* name) {
  UniqueFd fd(::openat(dirFd, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  struct stat st;
  if (!fd || ::fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode)) return std::nullopt;
  if (st.st_size < 0 || static_cast<size_t>(st.st_size) > kMaxSpooledJobBytes) return std::nullopt;
  plist::Bytes bytes(static_cast<size_t>(st.st_size));
  if (::pread(fd.get(), bytes.data(), bytes.size(), 0) != static_cast<ssize_t>(bytes.size())) {
    return std::nullopt;
  }
  std::optional<plist::Value> value = plist::Read(bytes);
  if (!value || !value->dictionary()) return std::nullopt;
  return *value->dictionary();
}

}  // namespace

std::optional<LaunchError> CheckJobLabel(const plist::Dictionary& job) {
  const plist::Value* value = job.find("Label");
  if (!value) return LaunchError{"the job has no Label"};
  const std::string* label = value->string();
  if (!label) return LaunchError{"the job's Label is not a string"};
  if (label->empty()) return LaunchError{"the job's Label is empty"};
  if (label->find('\0') != std::string::npos) return LaunchError{"the job's Label holds a NUL"};
  if (label->find('/') != std::string::npos) return LaunchError{"the job's Label holds a \"/\""};
  if (*label == "." || *label == "..") return LaunchError{"the job's Label is \".\" or \"..\""};
  if (label->size() > NAME_MAX) return LaunchError{"the job's Label is longer than a file name may be"};
  return std::nullopt;
}

std::optional<LaunchError> SpoolJobLauncher::Submit(const plist::Dictionary& job) {
  if (std::optional<LaunchError> error = CheckJobLabel(job)) return error;
  const std::string& label = *job.find("Label")->string();
  if (int error = MakeDirectories(directory_); error < 0) {
    return SystemError("cannot create the job spool", -error);
  }
  UniqueFd dir(::open(directory_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!dir) return SystemError("cannot open the job spool", errno);

  TemporaryFile file(dir.get());
  if (file.fd() < 0) return SystemError("cannot create the job file", file.error());
  if (!WriteAll(file.fd(), plist::WriteBinary(plist::Value(job))) || ::fsync(file.fd()) != 0) {
    return SystemError("cannot write the job file", errno);
  }
  if (::renameat2(dir.get(), file.name().c_str(), dir.get(), label.c_str(), RENAME_NOREPLACE) != 0) {
    if (errno == EEXIST) return LaunchError{"a job labelled \"" + label + "\" is already loaded"};
    return SystemError("cannot name the job file", errno);
  }
  file.Keep();
  return std::nullopt;
}

std::optional<std::vector<SpooledJob>> ReadJobSpool(const std::string& directory, std::string* error) {
  std::vector<SpooledJob> jobs;
  UniqueFd fd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd && errno == ENOENT) return jobs;
  if (!fd) {
    if (error) *error = "cannot open " + directory + ": " + std::strerror(errno);
    return std::nullopt;
  }
  DIR* dir = ::fdopendir(fd.get());
  if (!dir) {
    if (error) *error = "cannot read " + directory + ": " + std::strerror(errno);
    return std::nullopt;
  }
  fd.release();
  std::unique_ptr<DIR, int (*)(DIR*)> owned(dir, ::closedir);
  while (const dirent* entry = ::readdir(dir)) {
    std::optional<plist::Dictionary> job = ReadSpoolFile(::dirfd(dir), entry->d_name);
    const plist::Value* labelValue = job ? job->find("Label") : nullptr;
    const std::string* label = labelValue ? labelValue->string() : nullptr;
    if (label && *label == entry->d_name) jobs.push_back({*label, std::move(*job)});
  }
  std::sort(jobs.begin(), jobs.end(),
            [](const SpooledJob& a, const SpooledJob& b) { return a.label < b.label; });
  return jobs;
}

}  // namespace brisvale::jobs
