// Font path functions: which directory a font path lies in. Every test is a plain, case-sensitive
// prefix comparison of the raw path text, with no normalisation and no link resolution.
#pragma once

#include <string>
#include <string_view>

namespace typhora {

inline constexpr std::string_view kFontFilesDirectory = "/var/mobile/Library/UserFonts/FontFiles/";
inline constexpr std::string_view kFontAssetsDirectory =
    "/var/mobile/Library/UserFonts/FontAssets/";
inline constexpr std::string_view kAssetStoreDirectory =
    "/private/var/Cargell/AssetsV2/com_zorvane_Cargell_Font6/";

// The directory's path in normalised form (no trailing separator) followed by exactly one "/".
// Made once, on first use, and shared for the life of the process.
const std::string& fontFilesDirectoryPrefix();
const std::string& fontAssetsDirectoryPrefix();

bool isFontFilePath(std::string_view path);
bool isFontAssetPath(std::string_view path);
bool isAssetStorePath(std::string_view path);

// The path of the directory that holds the file at `path` (the path without its last component).
std::string_view parentDirectoryPath(std::string_view path);
// The name of the directory that directly holds the file at `path`: the last component left once
// the path's own last component is removed, with components counted as a URL's path counts them
// ("/d/p/" is in "d", "/d/p//f" in "p").
std::string_view containingDirectoryName(std::string_view path);

// What a file URL's path makes of a directory path: "." and empty components dropped, ".."
// folded, no trailing separator. Links are not resolved.
std::string normalisedDirectoryPath(std::string_view path);

}  // namespace typhora
