#include "jobs/plist_processor.h"

#include <array>
#include <string>

#include "base/log.h"
#include "platform/os.h"
#include "platform/services.h"

namespace brisvale {
namespace {

constexpr std::string_view kPrivatePrefix = "/private";
constexpr std::string_view kPrivateVar = "/private/var";
constexpr std::string_view kDeveloper = "/Developer";
constexpr std::string_view kFactoryMount = "/private/var/factory_mount";
constexpr std::string_view kPersonalizedFactory = "/private/var/personalized_factory";

struct AllowedRoot {
  std::string_view mountPointPrefix;
  std::string_view programPrefix;
};

// The first row whose mount-point prefix matches decides. The factory roots name their
// programs by the nominal "/Developer" path, which copyAndFixPlist rewrites.
constexpr std::array<AllowedRoot, 7> kAllowedRoots{{
    {"/private/var/debug_mount", "/private/var/debug_mount"},
    {"/Developer", "/Developer"},
    {kFactoryMount, kDeveloper},
    {"/private/var/personalized_automation", "/private/var/personalized_automation"},
    {"/private/var/personalized_debug", "/private/var/personalized_debug"},
    {"/private/var/personalized_demo", "/private/var/personalized_demo"},
    {kPersonalizedFactory, kDeveloper},
}};

// Plain character prefix: "/DeveloperTools" starts with "/Developer".
bool StartsWith(std::string_view text, std::string_view prefix) { return text.starts_with(prefix); }

bool IsFactoryMountPoint(std::string_view normalizedMountPoint) {
  return StartsWith(normalizedMountPoint, NormalizePath(kFactoryMount)) ||
         StartsWith(normalizedMountPoint, NormalizePath(kPersonalizedFactory));
}

// `path` with its first component replaced by `replacement`.
std::string ReplaceFirstComponent(std::string_view path, std::string_view replacement) {
  if (path.starts_with('/')) path.remove_prefix(1);
  const size_t slash = path.find('/');
  std::string result(replacement);
  if (slash != std::string_view::npos) result.append(path.substr(slash));
  return result;
}

}  // namespace

PlistProcessor& PlistProcessor::sharedPlistProcessor() {
  // A function-local static is made once, even against concurrent first calls, and
  // deliberately never destroyed.
  static PlistProcessor* const instance = new PlistProcessor();
  return *instance;
}

std::string NormalizePath(std::string_view path) {
  // Dropping the "/private" component is all the rewrite does; the match is a plain
  // prefix test, so "/private/variant" becomes "/variant" too.
  if (!path.starts_with(kPrivateVar)) return std::string(path);
  return std::string(path.substr(kPrivatePrefix.size()));
}

std::optional<plist::Array> CopyProgramArguments(const plist::Dictionary* plist) {
  if (!plist) {
    Log(Level::Default, "Invalid input.");
    return std::nullopt;
  }
  const plist::Value* value = plist->find("ProgramArguments");
  if (!value) value = plist->find("Program");
  if (value && value->array()) return *value->array();
  if (value && value->string()) return plist::Array{*value};
  Log(Level::Default, "Unexpected object: %@", value);
  return std::nullopt;
}

bool PlistProcessor::verifyPlist(const plist::Dictionary* plist,
                                 std::optional<std::string_view> mountPoint) const {
  const std::optional<plist::Array> args = CopyProgramArguments(plist);
  if (!mountPoint) {
    Log(Level::Default, "Invalid input.");
    return false;
  }
  if (!args) {
    Log(Level::Default, "Failed to retrieve program arguments.");
    return false;
  }
  const plist::Value* first = args->empty() ? nullptr : &args->front();
  if (!first || !first->string()) {
    Log(Level::Default, "Failed to normalize %@.", first);
    return false;
  }
  const std::string program = NormalizePath(*first->string());
  const std::string normalizedMountPoint = NormalizePath(*mountPoint);
  for (const AllowedRoot& root : kAllowedRoots) {
    if (StartsWith(normalizedMountPoint, NormalizePath(root.mountPointPrefix))) {
      return StartsWith(program, NormalizePath(root.programPrefix));
    }
  }
  return false;
}

std::optional<plist::Dictionary> PlistProcessor::copyAndFixPlist(
    const plist::Dictionary* plist, std::optional<std::string_view> mountPoint) const {
  if (!plist || !mountPoint) {
    Log(Level::Default, "invalid inputs");
    return std::nullopt;
  }
  const std::string mp = NormalizePath(*mountPoint);
  if (!IsFactoryMountPoint(mp)) return *plist;

  std::optional<plist::Array> args = CopyProgramArguments(plist);
  if (!args) {
    if (plist->find("VexaServiceName")) {
      Log(Level::Default, "Missing program arguments, likely a tethra plist.");
      return *plist;
    }
    Log(Level::Default, "Invalid program arguments");
    return std::nullopt;
  }
  const std::string* first = args->empty() ? nullptr : args->front().string();
  if (!first) {
    Log(Level::Default, "Invalid program arguments: %@", plist::Value(*args));
    return std::nullopt;
  }
  if (!StartsWith(*first, kDeveloper)) {
    Log(Level::Default, "Invalid program path: %@", *first);
    return plist::Dictionary{{"ERROR", "INVALID IMAGE"}};
  }
  // Whatever the first component is ("Developer", "DeveloperTools"), it stands for the
  // image's nominal location and becomes the real mount point.
  const std::string program = ReplaceFirstComponent(*first, mp);
  plist::Dictionary fixed = *plist;
  args->front() = plist::Value(program);
  fixed.set("ProgramArguments", plist::Value(std::move(*args)));
  fixed.erase("Program");
  return fixed;
}

void PlistProcessor::scanPlists(std::string_view directory,
                                const std::function<bool(const plist::Dictionary&)>& block) const {
  os::Os* os = CurrentServices().os;
  if (!os) return;
  const std::string path(directory);
  os->ReadFilesBelow(path.c_str(), kMaxJobFileBytes, [&](const os::FoundFile& file) {
    const std::optional<plist::Value> value = plist::Read(file.bytes);
    const plist::Dictionary* job = value ? value->dictionary() : nullptr;
    return !job || block(*job);
  });
}

}  // namespace brisvale
