#include "whitelist/desktop_entries.h"

#include "support/test_support.h"

#include <gtest/gtest.h>


namespace fbf::testing {
namespace {

std::string app(const std::string& extra = "") { return "[Desktop Entry]\nType=Application\nName=Tool\n" + extra; }

// Guards against: localised or other groups' keys read as plain ones, bad Hidden values, list escapes or trims lost.
TEST(DesktopEntryParsing, WhatOneFileSays) {
  struct Row {
    const char* name;
    std::string text;
    bool parses, isApplication, hidden;
    std::vector<std::string> implements;
  };
  const Row rows[] = {
      {"intents", app("Implements=org.freedesktop.Thing; vireon.Intents ;\n"), true, true, false,
       {"org.freedesktop.Thing", "vireon.Intents"}},
      {"comments and blank lines", "# c\n\n[Desktop Entry]\n# Type=Link\nType=Application\n\nHidden=true\n", true,
       true, true, {}},
      {"localised keys", "[Desktop Entry]\nType[fr]=Application\nHidden[de]=true\nImplements[de]=vireon.Intents\n",
       true, false, false, {}},
      {"other groups", "[Desktop Entry]\nType=Link\n[Desktop Action a]\nType=Application\nHidden=true\nImplements=x\n",
       true, false, false, {}},
      {"escaped separators", app("Implements=vireon\\;Intents;vireon\\sIntents\n"), true, true, false,
       {"vireon;Intents", "vireon Intents"}},
      {"invalid hidden value", app("Hidden=maybe\n"), true, true, false, {}},
      {"not a key file", "just text, no group\n", false, false, false, {}},
      {"no desktop entry group", "[Something Else]\nType=Application\n", false, false, false, {}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    std::string error;
    auto entry = parseDesktopEntry(row.text, &error);
    ASSERT_EQ(entry.has_value(), row.parses);
    EXPECT_EQ(error.empty(), row.parses);
    if (!entry) continue;
    EXPECT_EQ(entry->isApplication, row.isApplication);
    EXPECT_EQ(entry->hidden, row.hidden);
    EXPECT_EQ(entry->implements, row.implements);
  }
}

}  // namespace
}  // namespace fbf::testing
