// What removable-media unit tests publish and place: a medium's registry properties and
// the volume header of a file-system kind.
#pragma once

#include <algorithm>
#include <string>
#include <string_view>
#include <vector>

#include "base/plist.h"

namespace brisvale::testing {

inline plist::Dictionary Medium(std::string bsdName, bool removable, bool leaf = true, std::string content = "Linux") {
  return {{"BSD Name", plist::Value(std::move(bsdName))}, {"Content", plist::Value(std::move(content))},
          {"Removable", plist::Value::Bool(removable)},   {"Leaf", plist::Value::Bool(leaf)},
          {"Writable", plist::Value::Bool(true)}};
}

// A volume header of `kind`: "HFS+", "HFSX", "NTFS", "EXFAT" or FAT.
inline std::vector<uint8_t> VolumeHeader(std::string_view kind) {
  std::vector<uint8_t> header(1028, 0);
  if (kind.starts_with("HFS")) {
    header[1024] = 'H', header[1025] = kind == "HFS+" ? '+' : 'X', header[1027] = kind == "HFS+" ? 4 : 5;
  } else {
    const std::string_view oem = kind == "NTFS" ? "NTFS    " : kind == "EXFAT" ? "EXFAT   " : "MSDOS5.0";
    header[0] = 0xEB, header[2] = 0x90;
    std::copy(oem.begin(), oem.end(), header.begin() + 3);
  }
  return header;
}

}  // namespace brisvale::testing
