// Trust caches for images: the SHA-256 of every executable below a directory.
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <string>

#include "imgtool/commands.h"
#include "imgtool/options.h"
#include "imgtool/signing.h"
#include "platform/linux/format_trust_cache.h"

namespace brisvale::imgtool {

int BuildTrustCache(const std::vector<std::string>& args) {
  if (args.empty() || args.front().starts_with("-")) throw ToolError("trust-cache needs a directory", true);
  const Options options(std::vector<std::string>(args.begin() + 1, args.end()), {"--output"});
  const std::string output = options.Require("--output");
  namespace fs = std::filesystem;
  std::error_code error;
  std::vector<formats::TrustCacheEntry> entries;
  // Links are not followed: an image's trust cache covers the files the image holds.
  for (fs::recursive_directory_iterator it(args.front(), error), end; !error && it != end; it.increment(error)) {
    const fs::file_status status = it->symlink_status();
    const bool executable = (status.permissions() & (fs::perms::owner_exec | fs::perms::group_exec |
                                                     fs::perms::others_exec)) != fs::perms::none;
    if (!fs::is_regular_file(status) || !executable) continue;
    formats::TrustCacheEntry entry;
    const Bytes digest = DigestOfFile(it->path().string(), EVP_sha256());
    std::copy_n(digest.begin(), std::min(digest.size(), entry.hash.size()), entry.hash.begin());
    entries.push_back(entry);
  }
  if (error) throw ToolError("cannot read " + args.front() + ": " + error.message());
  WriteFile(output, formats::BuildTrustCache(std::move(entries)));
  return 0;
}

}  // namespace brisvale::imgtool
