#include "daemon/paths.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

namespace typhora {
namespace {

TEST(FontPaths, PrefixesEndInExactlyOneSeparator) {
  EXPECT_EQ(fontFilesDirectoryPrefix(), "/var/mobile/Library/UserFonts/FontFiles/");
  EXPECT_EQ(fontAssetsDirectoryPrefix(), "/var/mobile/Library/UserFonts/FontAssets/");
  // Made once: every caller, on any thread, sees the same object.
  std::vector<const std::string*> seen(8);
  std::vector<std::thread> threads;
  for (auto& slot : seen) threads.emplace_back([&slot] { slot = &fontFilesDirectoryPrefix(); });
  for (auto& t : threads) t.join();
  for (const std::string* p : seen) EXPECT_EQ(p, &fontFilesDirectoryPrefix());
}

TEST(FontPaths, NormalisedFormDropsDotsDuplicatesAndTrailingSeparators) {
  EXPECT_EQ(normalisedDirectoryPath("/var//mobile/./Library/"), "/var/mobile/Library");
  EXPECT_EQ(normalisedDirectoryPath("/var/mobile/x/../Library"), "/var/mobile/Library");
  EXPECT_EQ(normalisedDirectoryPath("/"), "/");
  EXPECT_EQ(normalisedDirectoryPath("/.."), "/");
}

TEST(FontPaths, MembershipIsAPlainCaseSensitivePrefixTest) {
  EXPECT_TRUE(isFontFilePath("/var/mobile/Library/UserFonts/FontFiles/com.a/A.otf"));
  EXPECT_TRUE(isFontFilePath("/var/mobile/Library/UserFonts/FontFiles/"));
  EXPECT_FALSE(isFontFilePath("/var/mobile/Library/UserFonts/FontFiles"));
  EXPECT_FALSE(isFontFilePath("/var/mobile/library/userfonts/fontfiles/com.a/A.otf"));
  EXPECT_FALSE(isFontFilePath("/private/var/mobile/Library/UserFonts/FontFiles/A.otf"));
  // No normalisation: a path that leaves the directory through ".." still matches the text.
  EXPECT_TRUE(isFontFilePath("/var/mobile/Library/UserFonts/FontFiles/../../x"));

  EXPECT_TRUE(isFontAssetPath("/var/mobile/Library/UserFonts/FontAssets/Marisol/M.ttf"));
  EXPECT_FALSE(isFontAssetPath("/var/mobile/Library/UserFonts/FontFiles/M.ttf"));
  EXPECT_FALSE(isFontAssetPath("/var/mobile/Library/UserFonts/FontAssetsX/M.ttf"));

  EXPECT_TRUE(isAssetStorePath("/private/var/Cargell/AssetsV2/com_zorvane_Cargell_Font6/a/b"));
  EXPECT_FALSE(isAssetStorePath("/var/Cargell/AssetsV2/com_zorvane_Cargell_Font6/a/b"));
  EXPECT_FALSE(isAssetStorePath(""));
}

}  // namespace
}  // namespace typhora
