// What the pages for people who change this code name is there: commands, files, folders, names of the code.
#include <gtest/gtest.h>

#include <cctype>
#include <filesystem>
#include <utility>

#include "tests/tools/ManualText.h"

namespace kyt {
namespace {

namespace fs = std::filesystem;

const fs::path kSource = KYT_SOURCE_DIR;

// What stands between backticks on one line.
Names quotedIn(const std::string& text) {
  return matchesIn(text, "`([^`\n]+)`");
}

// The quoted paths of this tree, but for those of a build.
Names pathsIn(const std::string& text) {
  Names paths;
  for (const std::string& quoted : quotedIn(text))
    if (std::regex_match(quoted, std::regex("[.A-Za-z][A-Za-z0-9_.-]*/[A-Za-z0-9_./-]*")) &&
        !quoted.starts_with("./") && !quoted.starts_with("build/"))
      paths.insert(quoted);
  return paths;
}

Names missingOf(const Names& paths) {
  Names missing;
  for (const std::string& path : paths)
    if (!fs::exists(kSource / path)) missing.insert(path);
  return missing;
}

// The text below that heading.
std::string below(const std::string& document, const std::string& heading) {
  std::string section;
  bool inside = false;
  for (const std::string& line : linesOf(textOf(document))) {
    if (line.starts_with("## ")) inside = line == "## " + heading;
    if (inside) section += line + "\n";
  }
  return section;
}

// The words of the production code.
Names wordsOfTheCode() {
  Names words;
  for (const char* folder : {"platform", "config", "backend", "backends", "session", "daemon"})
    for (const auto& entry : fs::recursive_directory_iterator(kSource / folder)) {
      if (!entry.is_regular_file()) continue;
      std::string word;
      for (const char c : textOf(fs::relative(entry.path(), kSource).string())) {
        if (std::isalnum(static_cast<unsigned char>(c)) != 0 || c == '_') {
          word += c;
        } else if (!word.empty()) {
          words.insert(std::exchange(word, {}));
        }
      }
    }
  return words;
}

// The quoted names of the code, as `Executor::borrow` or `addAndMayLog()`, of which the code does not know a part.
Names unknownNamesIn(const std::string& text) {
  static const Names known = wordsOfTheCode();
  Names unknown;
  for (const std::string& quoted : quotedIn(text)) {
    if (!std::regex_match(quoted, std::regex("_?[A-Za-z]+(::[A-Za-z]+)?(\\(\\))?"))) continue;
    for (const std::string& part : matchesIn(quoted, "(\\w+)"))
      if (!known.contains(part)) unknown.insert(quoted);
  }
  return unknown;
}

TEST(ContributingDocument, NamesEachCommandAndNoOther) {
  const std::string script = textOf("kyt");
  const size_t begin = script.find("\nusage: ");
  ASSERT_NE(begin, std::string::npos);
  const std::string usage = script.substr(begin, script.find("\nTEXT\n") - begin);
  const Names commands = matchesIn(usage, "\n  ([a-z]+) ");
  ASSERT_GE(commands.size(), 8U);
  EXPECT_EQ(matchesIn(textOf("CONTRIBUTING.md"), "`\\./kyt ([a-z]+)"), commands);
  EXPECT_EQ(matchesIn(script.substr(script.find("\ncase $command in")), "\n  ([a-z]+)\\)"), commands);
}

TEST(ContributingDocument, NamesEachPreset) {
  Names presets = matchesIn(textOf("CMakePresets.json"), "\"name\": \"([a-z-]+)\"");
  presets.erase("base");
  std::string row;
  for (const std::string& line : linesOf(textOf("CONTRIBUTING.md")))
    if (line.starts_with("| build |")) row = line.substr(line.find("with one of"));
  Names named = matchesIn(row, "`([a-z-]+)`");
  EXPECT_EQ(named, presets);
}

TEST(ContributingDocument, NamesOnlyFilesAndFoldersThatThereAre) {
  const Names paths = pathsIn(textOf("CONTRIBUTING.md"));
  EXPECT_GE(paths.size(), 30U);
  EXPECT_EQ(missingOf(paths), Names());
}

TEST(ContributingDocument, NamesOnlyWhatTheCodeKnows) {
  const std::string places = below("CONTRIBUTING.md", "Where something new goes");
  EXPECT_GE(quotedIn(places).size(), 30U);
  EXPECT_EQ(unknownNamesIn(places), Names());
}

// The packages of a list: one a line, a remark after "#".
Names packagesOfTheBuild() {
  Names packages;
  for (const std::string& line : linesOf(textOf("packaging/build-deps")))
    if (const std::string package = line.substr(0, line.find_first_of(" #")); !package.empty())
      packages.insert(package);
  return packages;
}

TEST(BuildDependencies, OfTheLanguagesOfExamplesAreNamedByBothGuidesAndNotNeeded) {
  const std::string script = textOf("tests/install/check-quickstarts");
  Names packages = matchesIn(script, "\"([a-z-]+) is not installed\"");
  packages.merge(matchesIn(script, "lacks [a-z]+ ([a-z-]+)"));
  packages.erase("systemd");
  EXPECT_EQ(packages.size(), 7U);
  const Names guide = quotedIn(textOf("docs/PROGRAMS.md")),
              contributing = quotedIn(textOf("CONTRIBUTING.md")), needed = packagesOfTheBuild();
  for (const std::string& package : packages) {
    EXPECT_TRUE(guide.contains(package)) << package;
    EXPECT_TRUE(contributing.contains(package)) << package;
    EXPECT_FALSE(needed.contains(package)) << package;
  }
}

TEST(BuildDependencies, OfTheDebianPackagesAreThoseOfTheBuildWithoutTests) {
  const std::string control = textOf("packaging/debian/control");
  const size_t begin = control.find("\nBuild-Depends:\n"), end = control.find("\n\n", begin);
  ASSERT_NE(begin, std::string::npos);
  const Names named = matchesIn(control.substr(begin, end - begin), "\n ([a-z0-9-]+)");
  const Names needed = packagesOfTheBuild();
  for (const std::string& package : named)
    EXPECT_TRUE(needed.contains(package) || package.starts_with("debhelper-compat") ||
                package.starts_with("dh-sequence-"))
        << package;
  // What only tests have; the compilers are on any machine that builds packages.
  const Names tests = {"libclang-rt-14-dev", "libgtest-dev", "libgmock-dev"};
  for (const std::string& package : needed)
    if (package.ends_with("-dev") && package != "dpkg-dev") {
      EXPECT_NE(named.contains(package), tests.contains(package)) << package;
    }
  // As long as that build runs none.
  const std::string rules = textOf("packaging/debian/rules");
  EXPECT_NE(rules.find("-DKYT_TESTS=OFF"), std::string::npos);
  EXPECT_NE(rules.find("\noverride_dh_auto_test:\n\n"), std::string::npos);
}

TEST(ArchitectureDocument, NamesOnlyFilesAndFoldersThatThereAre) {
  const Names paths = pathsIn(textOf("docs/ARCHITECTURE.md"));
  EXPECT_GE(paths.size(), 15U);
  Names missing;
  for (const std::string& path : missingOf(paths))  // a folder of backends/ is named without it
    if (!fs::exists(kSource / "backends" / path)) missing.insert(path);
  missing.erase("backends/X");
  EXPECT_EQ(missing, Names());
}

TEST(ArchitectureDocument, NamesEachFolder) {
  const std::string folders = below("docs/ARCHITECTURE.md", "The folders");
  const Names named = quotedIn(folders);
  for (const char* above : {".", "platform", "platform/linux", "backends"})
    for (const auto& entry : fs::directory_iterator(kSource / above)) {
      if (!fs::exists(entry.path() / "CMakeLists.txt")) continue;
      const std::string path = fs::relative(entry.path(), kSource).string();
      const std::string name = entry.path().filename().string();
      EXPECT_TRUE(named.contains(path + "/") || named.contains(name + "/") || named.contains(name)) << path;
    }
}

TEST(ArchitectureDocument, ExplainsOnlyNamesOfTheCode) {
  const std::string names = below("docs/ARCHITECTURE.md", "Names");
  EXPECT_GE(quotedIn(names).size(), 8U);
  EXPECT_EQ(unknownNamesIn(names), Names());
}

TEST(ThreadsDocument, ExplainsOnlyWordsOfTheCode) {
  const std::string words = below("docs/THREADS.md", "Words");
  EXPECT_GE(quotedIn(words).size(), 6U);
  EXPECT_EQ(unknownNamesIn(words), Names());
}

}  // namespace
}  // namespace kyt
