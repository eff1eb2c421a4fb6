#include "font_corpus.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/file.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>

#include "platform/fd/unique_fd.h"

namespace typhora::bench {
namespace {

namespace fs = std::filesystem;

constexpr int kFontsPerDirectory = 100;

std::vector<fs::path> debianFonts() {
  std::vector<fs::path> fonts;
  std::error_code ec;
  for (const auto& entry : fs::recursive_directory_iterator("/usr/share/fonts", ec)) {
    const std::string ext = entry.path().extension().string();
    if (entry.is_regular_file() && (ext == ".ttf" || ext == ".otf")) fonts.push_back(entry.path());
  }
  return fonts;
}

// Runs argv with FONTCONFIG_FILE set, output discarded; the exit status.
int runWithConfig(const std::string& configFile, std::vector<const char*> argv) {
  argv.push_back(nullptr);
  // Spawned, not forked, as the daemon is: neither start pays for copying this process.
  std::vector<std::string> variables;
  for (char** at = environ; *at != nullptr; ++at) {
    if (std::strncmp(*at, "FONTCONFIG_FILE=", 16) != 0) variables.emplace_back(*at);
  }
  variables.push_back("FONTCONFIG_FILE=" + configFile);
  std::vector<char*> envp;
  for (std::string& variable : variables) envp.push_back(variable.data());
  envp.push_back(nullptr);
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
  posix_spawn_file_actions_adddup2(&actions, 1, 2);
  pid_t pid = -1;
  const int failed = posix_spawnp(&pid, argv[0], &actions, nullptr,
                                  const_cast<char* const*>(argv.data()), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  if (failed != 0) return -1;
  int status = 0;
  waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

}  // namespace

FontCorpus::FontCorpus(int fonts)
    : dir_("/tmp/typhora-compare-fonts-" + std::to_string(fonts)),
      configFile_(dir_ + "/fonts.conf") {
  // Benchmarks run side by side (several worktrees) lay the corpus out once, one at a time.
  UniqueFd lock(open((dir_ + ".lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644));
  if (lock.valid()) flock(lock.get(), LOCK_EX);
  if (!fs::exists(dir_ + "/complete") && !generate(fonts)) return;
  config_ = FcConfigCreate();
  if (!FcConfigParseAndLoad(config_, reinterpret_cast<const FcChar8*>(configFile_.c_str()),
                            FcTrue) ||
      !FcConfigBuildFonts(config_)) {
    FcConfigDestroy(config_);
    config_ = nullptr;
    return;
  }
  FcFontSet* set = FcConfigGetFonts(config_, FcSetSystem);
  for (int i = 0; set != nullptr && i < set->nfont; ++i) {
    FcChar8* family = nullptr;
    if (FcPatternGetString(set->fonts[i], FC_FAMILY, 0, &family) != FcResultMatch) continue;
    const std::string name(reinterpret_cast<const char*>(family));
    if (std::find(families_.begin(), families_.end(), name) == families_.end())
      families_.push_back(name);
  }
}

FontCorpus::~FontCorpus() {
  if (config_ != nullptr) FcConfigDestroy(config_);
}

bool FontCorpus::generate(int fonts) {
  const std::vector<fs::path> sources = debianFonts();
  if (sources.empty()) return false;
  std::error_code ec;
  fs::remove_all(dir_, ec);
  fs::remove_all(cacheDir(), ec);
  std::fprintf(stderr, "compare: laying out %d font files in %s (once)\n", fonts, dir_.c_str());
  for (int i = 0; i < fonts; ++i) {
    const fs::path directory = fs::path(dir_) / ("d" + std::to_string(i / kFontsPerDirectory));
    fs::create_directories(directory);
    const fs::path& source = sources[static_cast<std::size_t>(i) % sources.size()];
    const fs::path target = directory / ("f" + std::to_string(i) + source.extension().string());
    fs::create_hard_link(source, target, ec);
    if (ec && !fs::copy_file(source, target, ec)) return false;
  }
  std::ofstream(configFile_) << "<?xml version=\"1.0\"?>\n<!DOCTYPE fontconfig SYSTEM "
                                "\"urn:fontconfig:fonts.dtd\">\n<fontconfig><dir>"
                             << dir_ << "</dir><cachedir>" << cacheDir()
                             << "</cachedir></fontconfig>\n";
  std::fprintf(stderr, "compare: building the fontconfig cache (once)\n");
  if (runWithConfig(configFile_, {"fc-cache", "-f"}) != 0) return false;
  std::ofstream(dir_ + "/complete") << fonts << "\n";
  return true;
}

bool FontCorpus::match(const std::string& family) const {
  FcPattern* pattern = FcPatternCreate();
  FcPatternAddString(pattern, FC_FAMILY, reinterpret_cast<const FcChar8*>(family.c_str()));
  FcConfigSubstitute(config_, pattern, FcMatchPattern);
  FcDefaultSubstitute(pattern);
  FcResult result = FcResultNoMatch;
  FcPattern* found = FcFontMatch(config_, pattern, &result);
  FcPatternDestroy(pattern);
  if (found == nullptr) return false;
  FcPatternDestroy(found);
  return true;
}

double FontCorpus::timeFcList() const {
  const auto start = std::chrono::steady_clock::now();
  runWithConfig(configFile_, {"fc-list"});
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

}  // namespace typhora::bench
