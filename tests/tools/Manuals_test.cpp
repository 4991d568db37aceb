// The manual pages say what the programs, the settings and the documents say.
#include <gtest/gtest.h>

#include <filesystem>
#include <span>

#include "platform/base/Counters.h"
#include "platform/linux/toml/TomlSettings.h"
#include "tests/tools/ManualText.h"
#include "tools/events/EventsFile.h"

namespace kyt {
namespace {

std::vector<std::string> pages() {
  std::vector<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(KYT_SOURCE_DIR "/packaging/man"))
    names.push_back(entry.path().filename().string());
  return names;
}

TEST(Manuals, AreWithoutWarnings) {
  if (!isInstalled("mandoc")) GTEST_SKIP() << "mandoc is not installed";
  for (const std::string& page : pages()) {
    const ProgramRun lint =
        runProgram("mandoc", {"-T", "lint", "-W", "warning", KYT_SOURCE_DIR "/packaging/man/" + page});
    EXPECT_EQ(lint.status, 0) << lint.text;
    EXPECT_EQ(lint.text, "");
  }
}

TEST(Manuals, ReferToEachOtherByNamesThatThereAre) {
  const std::vector<std::string> all = pages();
  const Names names(all.begin(), all.end());
  for (const std::string& page : all)
    for (const std::string& line : linesOf(textOf("packaging/man/" + page))) {
      std::smatch match;
      if (!std::regex_search(line, match, std::regex("Xr ((?:lib)?kyt[a-z.-]*) ([1-8])"))) continue;
      EXPECT_TRUE(names.contains(match[1].str() + "." + match[2].str())) << page << ": " << line;
    }
}

class ManualOf : public ::testing::TestWithParam<const char*> {};

TEST_P(ManualOf, NamesTheProgramsOptionsAndNoOthers) {
  const std::string page = GetParam();
  const std::string program = page.substr(0, page.find('.'));
  const Help help = helpOf(program);
  EXPECT_GE(help.options.size(), 4U);
  EXPECT_EQ(optionsOf(sectionOf(page, "")), help.options);
  for (const auto& [option, values] : help.values)
    for (const std::string& line : linesOf(itemsOf(sectionOf(page, ""))))
      if (line.find("Fl Fl " + option.substr(2) + " ") != std::string::npos) {
        EXPECT_EQ(matchesIn(line.substr(line.find(" Cm ") + 4), "([a-z]+)"), values) << line;
      }
}

INSTANTIATE_TEST_SUITE_P(Programs, ManualOf,
                         ::testing::Values("kytreportingd.8", "kytreader.8", "kytreceiver.8",
                                           "kytdevserver.1", "kytfeed.1", "kytdemo.1", "kytsource-units.8",
                                           "kytsource-boots.8", "kytsource-crashes.8",
                                           "kytsource-resources.8"),
                         [](const auto& test) {
                           std::string page = test.param;
                           page = page.substr(0, page.find('.'));
                           std::erase(page, '-');
                           return page;
                         });

TEST(DevelopmentServersGuide, NamesEachOption) {
  std::string rows;
  const std::string guide = textOf("docs/DEVSERVER.md");
  for (const std::string& line : linesOf(guide))
    if (line.starts_with("| `--")) rows += line.substr(0, line.find('|', 1)) + "\n";
  Names options = helpOf("kytdevserver").options;
  for (const char* common : {"-h", "--help", "--version"}) options.erase(common);
  EXPECT_EQ(matchesIn(rows, "`(--[a-z-]+)"), options);
}

TEST(ManualOfKytctl, NamesEachCommandWithItsOptions) {
  const Names everywhere{"-h", "--help", "--version", "--root"};
  const Help top = helpOf("kytctl");
  EXPECT_EQ(top.options, everywhere);
  EXPECT_EQ(optionsOf(sectionOf("kytctl.1", "DESCRIPTION")), everywhere);
  EXPECT_EQ(matchesIn(textOf("packaging/man/kytctl.1"), "\n\\.Ss kytctl ([a-z-]+)"), top.commands);
  for (const std::string& group : top.commands) {
    const std::string section = sectionOf("kytctl.1", "kytctl " + group);
    const Help help = helpOf("kytctl", {group});
    Names options = help.options;
    EXPECT_EQ(matchesIn(itemsOf(section), "\\.It Cm ([a-z]+)"), help.commands) << group;
    for (const std::string& command : help.commands) {
      const Help leaf = helpOf("kytctl", {group, command});
      EXPECT_TRUE(leaf.commands.empty());
      options.insert(leaf.options.begin(), leaf.options.end());
      for (const auto& [option, values] : leaf.values) {
        std::string tag = "Fl Fl " + option.substr(2) + " Cm";
        const size_t at = section.find(tag);
        ASSERT_NE(at, std::string::npos) << tag;
        const std::string line = section.substr(at + tag.size(), section.find('\n', at) - at - tag.size());
        EXPECT_EQ(matchesIn(line, "([a-z+]+)"), values) << tag;
      }
    }
    for (const std::string& common : everywhere) options.erase(common);
    EXPECT_EQ(optionsOf(section), options) << group;
  }
}

TEST(ManualOfKytctl, ShowsEachCommandInItsSynopsis) {
  Names shown, commands;
  for (const std::string& line : linesOf(sectionOf("kytctl.1", "SYNOPSIS"))) {
    std::smatch match;
    if (!std::regex_match(line, match, std::regex("\\.Cm ([a-z-]+)((?: \\|| [a-z]+)*)"))) continue;
    const Names leaves = matchesIn(match[2], "([a-z]+)");
    for (const std::string& leaf : leaves) shown.insert(match[1].str() + " " + leaf);
    if (leaves.empty()) shown.insert(match[1].str());
  }
  for (const std::string& group : helpOf("kytctl").commands) {
    const Help help = helpOf("kytctl", {group});
    for (const std::string& command : help.commands) commands.insert(group + " " + command);
    if (help.commands.empty()) commands.insert(group);
  }
  EXPECT_EQ(shown, commands);
}

TEST(ManualOfKytctl, NamesEachStepOfAScriptedSession) {
  const std::string source = textOf("tools/kytctl/SessionScript.cpp");
  const Names steps = matchesIn(source, "&Script::([A-Za-z]+)");
  EXPECT_GE(steps.size(), 10U);
  EXPECT_EQ(matchesIn(itemsOf(sectionOf("kytctl.1", "kytctl session")), "\\.It Ic ([A-Za-z]+)"), steps);
  const std::string help = runProgram(KYT_PROGRAMS "/kytctl", {"session", "--help"}).text;
  EXPECT_EQ(matchesIn(help, "\"do\":\"([A-Za-z]+)\""), steps);
}

TEST(ManualOfEvents, NamesEachKeyTypeAndKindOfFinding) {
  const std::string page = "kytreporting-events.toml.5";
  const auto keysOf = [&page](const char* title) {
    return matchesIn(itemsOf(sectionOf(page, title)), "(?:Ic|,) ([a-z]+)");
  };
  const auto names = [](std::span<const std::string> known) { return Names(known.begin(), known.end()); };
  const tools::EventKeys& keys = tools::eventKeys();
  EXPECT_EQ(keysOf("The file"), names(keys.ofFile));
  EXPECT_EQ(keysOf("An event"), names(keys.ofEvent));
  EXPECT_EQ(keysOf("A field"), names(keys.ofField));
  EXPECT_EQ(matchesIn(sectionOf(page, "A field"), "\\.Ql ([a-z]+)"), names(keys.types));
  EXPECT_EQ(matchesIn(itemsOf(sectionOf(page, "What check finds")), "Li ([a-z0-9-]+)"),
            matchesIn(textOf("tools/events/EventsCheck.h"), "\"([a-z]+-[a-z0-9-]+|replaced)\""));
}

// The settings: the code, the page and the administrator's guide.
const std::string kRequired =
    "[storebag]\ninternal_host = \"https://a.example.org\"\npublic_host = \"https://b.example.org\"\n";

// The settings that a minimal file with that value has, and those without it.
void expectDefault(const std::string& name, const std::string& value, const char* where) {
  const size_t dot = name.find('.');
  const auto plain = parseSettings(kRequired, "plain");
  // What is required has its section already.
  const std::string section = name.starts_with("storebag.") ? "" : "[" + name.substr(0, dot) + "]\n";
  const auto same = parseSettings(kRequired + section + name.substr(dot + 1) + " = " + value + "\n", where);
  const auto* error = std::get_if<TomlError>(&same);
  ASSERT_EQ(error, nullptr) << where << ": " << name << " = " << value << ": " << error->text;
  EXPECT_EQ(std::get<Settings>(same), std::get<Settings>(plain))
      << where << ": " << name << " is not " << value;
}

bool hasDefault(const std::string& name) {
  return name != "storebag.internal_host" && name != "storebag.public_host" && name != "tls.ca_file" &&
         name != "admin.group";
}

TEST(ManualOfTheSettings, NamesEachSettingWithItsDefault) {
  const std::vector<std::string> settings = settingNames();
  const Names names(settings.begin(), settings.end());
  const std::string items = itemsOf(sectionOf("kytreportingd.toml.5", ""));
  EXPECT_EQ(matchesIn(items, "\\.It Ic ([a-z]+\\.[a-z0-9_]+)"), names);
  size_t checked = 0;
  for (const std::string& line : linesOf(items)) {
    std::smatch match;
    if (!std::regex_match(line, match, std::regex("\\.It Ic ([a-z0-9._]+) No = Li (.*)"))) continue;
    expectDefault(match[1], std::regex_replace(match[2].str(), std::regex("\\\\\\(dq"), "\""),
                  "the manual page");
    ++checked;
  }
  EXPECT_EQ(checked, static_cast<size_t>(std::count_if(settings.begin(), settings.end(), hasDefault)));
}

TEST(AdministratorsGuide, NamesEachSettingWithItsDefault) {
  const std::vector<std::string> settings = settingNames();
  const std::string guide = textOf("docs/ADMINISTRATION.md");
  EXPECT_EQ(
      matchesIn(
          guide,
          "\n\\| `((?:storebag|tls|network|limits|service|log|compression|admin|outbox)\\.[a-z0-9_]+)` \\|"),
      Names(settings.begin(), settings.end()));
  for (const std::string& name : settings) {
    if (!hasDefault(name)) continue;
    std::smatch match;
    ASSERT_TRUE(std::regex_search(guide, match, std::regex("\n\\| `" + name + "` \\| ([^|]*) \\|"))) << name;
    std::string value = match[1] == "none" ? "[]" : match[1].str();
    std::erase(value, '`');
    expectDefault(name, value, "the guide");
  }
}

TEST(SettingsOfThePackages, ChooseLibdeflate) {
  std::string text = textOf("packaging/debian/etc/kytreportingd.toml");
  text = std::regex_replace(text, std::regex("#(internal_host|public_host)"), "$1");
  const auto settings = parseSettings(text, "the packages' settings");
  ASSERT_TRUE(std::holds_alternative<Settings>(settings)) << std::get<TomlError>(settings).text;
  EXPECT_EQ(std::get<Settings>(settings).compression,
            (CompressionSettings{CompressionLibrary::libdeflate, 5}));
}

TEST(AnotherNumberThanTheDefault, IsNoticed) {
  EXPECT_NE(std::get<Settings>(parseSettings(kRequired + "[limits]\nmax_connections = 16383\n", "")),
            std::get<Settings>(parseSettings(kRequired, "")));
  EXPECT_NE(std::get<Settings>(parseSettings(kRequired + "[log]\ntarget = \"stderr\"\n", "")),
            std::get<Settings>(parseSettings(kRequired, "")));
}

Names counters() {
  Names names;
  for (size_t i = 0; i < static_cast<size_t>(Reason::numberOfReasons); ++i)
    names.insert(reasonName(static_cast<Reason>(i)));
  return names;
}

TEST(ManualOfTheDaemon, NamesEachCounter) {
  EXPECT_EQ(matchesIn(itemsOf(sectionOf("kytreportingd.8", "Counters")), "\\.It Li ([a-z-]+) Ta"),
            counters());
}

TEST(AdministratorsGuide, NamesEachCounter) {
  const std::string guide = textOf("docs/ADMINISTRATION.md");
  const size_t at = guide.find("\n## Counters\n");
  ASSERT_NE(at, std::string::npos);
  std::string rows;
  for (const std::string& line : linesOf(guide.substr(at, guide.find("\n## ", at + 1) - at)))
    if (line.starts_with("| `")) rows += line.substr(0, line.find('|', 1)) + "\n";
  EXPECT_EQ(matchesIn(rows, "`([a-z-]+)`"), counters());
}

TEST(AdministratorsGuide, NamesEachFateOfAnEvent) {
  const std::string guide = textOf("docs/ADMINISTRATION.md");
  const size_t at = guide.find("\n## The books\n");
  ASSERT_NE(at, std::string::npos);
  Names fates;
  for (const Reason fate : kFates) fates.insert(reasonName(fate));
  EXPECT_EQ(matchesIn(guide.substr(at, guide.find("\n## ", at + 1) - at), "\n\\| `([a-z-]+)` \\|"), fates);
}

TEST(ManualOfTheStorebag, NamesTheKeysOfTheWireFormatsDocument) {
  const std::string document = textOf("docs/WIRE-STOREBAG.md");
  Names keys;
  for (const std::string& line : linesOf(document.substr(document.find("\n## The bag\n")))) {
    if (line.find("uploadserver") != std::string::npos) break;
    if (line.starts_with("| `"))
      for (const std::string& key : matchesIn(line.substr(0, line.find('|', 1)), "`([A-Za-z_]+)`"))
        keys.insert(key);
  }
  EXPECT_GE(keys.size(), 25U);
  Names named;
  for (const std::string& line : linesOf(itemsOf(sectionOf("kytreportingd-storebag.5", ""))))
    for (const std::string& key : matchesIn(line, "[ ,]([A-Za-z_]{2,})(?= |$)"))
      if (key != "Ic") named.insert(key);
  EXPECT_EQ(named, keys);
}

TEST(ManualOfTheLibrary, NamesEachFunctionOfTheHeaders) {
  const std::string page = textOf("packaging/man/libkytreporting.3");
  const Names functions =
      matchesIn(textOf("client/include/kytreporting/kytreporting.h"), "\\b(kyt_[a-z_]+)\\(");
  EXPECT_GE(functions.size(), 30U);
  EXPECT_EQ(matchesIn(page, "Fn (kyt_[a-z_]+)"), functions);
  const std::string header = textOf("client/include/kytreporting/KYTReporting.h");
  const size_t at = header.find("class KYT_EXPORT KYTReporting");
  const Names operations = matchesIn(header.substr(at, header.find(" private:", at) - at),
                                     "\n  [A-Za-z:\\[\\]<> _*]*?\\b((?!void)[a-z][A-Za-z]+)\\(");
  EXPECT_GE(operations.size(), 13U);
  EXPECT_EQ(matchesIn(page, "\\.Fn ([a-z][A-Za-z]+)[ \n]"), operations);
}

}  // namespace
}  // namespace kyt
