// Real font files for fontconfig: hard links (copies where links fail) of the fonts Debian
// installed under /usr/share/fonts, spread over directories, with a configuration naming only
// them and a cache built once. Kept between runs in a fixed directory under /tmp.
#pragma once

#include <fontconfig/fontconfig.h>

#include <string>
#include <vector>

namespace typhora::bench {

class FontCorpus {
 public:
  explicit FontCorpus(int fonts);
  ~FontCorpus();
  FontCorpus(const FontCorpus&) = delete;
  FontCorpus& operator=(const FontCorpus&) = delete;

  bool ready() const { return config_ != nullptr; }
  const std::string& configFile() const { return configFile_; }
  // Family names present in the corpus.
  const std::vector<std::string>& families() const { return families_; }
  // FcFontMatch of one family name over the corpus; true when some font came back.
  bool match(const std::string& family) const;
  // Seconds `fc-list` takes over the corpus, from exec to exit.
  double timeFcList() const;

 private:
  bool generate(int fonts);
  // fontconfig's cache lies beside the fonts: inside the scanned tree, a cache left by an earlier
  // layout makes fc-cache see looped directories and fail.
  std::string cacheDir() const { return dir_ + ".cache"; }

  std::string dir_;
  std::string configFile_;
  std::vector<std::string> families_;
  FcConfig* config_ = nullptr;
};

}  // namespace typhora::bench
