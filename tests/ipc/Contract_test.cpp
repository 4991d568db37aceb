// The table of the contract is what the interface description says.
#include <gtest/gtest.h>

#include <regex>
#include <string>
#include <vector>

#include "platform/ipc/AdministrationDispatcher.h"
#include "platform/ipc/Contract.h"
#include "platform/ipc/InterfaceDescription.h"
#include "platform/ipc/Wire.h"

namespace kyt {
namespace {

struct Described {
  std::string member, in, out;
};

// The methods of one interface, in the description's order.
std::vector<Described> describedMethods(std::string_view interface,
                                        const std::string& all = interfaceDescription()) {
  const size_t begin = all.find("<interface name=\"" + std::string(interface) + "\">");
  if (begin == std::string::npos) return {};
  const std::string text = all.substr(begin, all.find("</interface>", begin) - begin);
  std::vector<Described> methods;
  const std::regex element(
      "<method name=\"([^\"]+)\"|<arg name=\"[^\"]+\" type=\"([^\"]+)\" direction=\"(in|out)\"");
  for (std::sregex_iterator at(text.begin(), text.end(), element), end; at != end; ++at) {
    const std::smatch& found = *at;
    if (found[1].matched)
      methods.push_back({found[1], "", ""});
    else
      (found[3] == "in" ? methods.back().in : methods.back().out) += found[2];
  }
  return methods;
}

TEST(Contract, IsWhatTheInterfaceDescriptionSays) {
  const std::vector<Described> described = describedMethods(wire::kSessionInterface);
  ASSERT_EQ(described.size(), wire::kMethods.size());
  for (const Described& method : described) {
    const wire::MethodContract* found = nullptr;
    for (const wire::MethodContract& row : wire::kMethods)
      if (row.member == method.member) found = &row;
    ASSERT_NE(found, nullptr) << method.member;
    EXPECT_EQ(found->signature, method.in) << method.member;
    EXPECT_EQ(found->reply, method.out) << method.member;
    EXPECT_EQ(&wire::contractOf(found->method), found) << method.member;
  }
}

TEST(Contract, OfAdministratorsIsWhatTheInterfaceDescriptionSays) {
  const std::vector<Described> described =
      describedMethods(wire::kAdministrationInterface, administrationDescription());
  ASSERT_EQ(described.size(), kAdministrationMethods.size());
  for (size_t i = 0; i < described.size(); ++i) {
    EXPECT_EQ(kAdministrationMethods[i].member, described[i].member);
    EXPECT_EQ(kAdministrationMethods[i].signature, described[i].in) << described[i].member;
    EXPECT_EQ(kAdministrationMethods[i].reply, described[i].out) << described[i].member;
  }
}

TEST(Contract, HasTheDaemonsCallAsTheInterfaceDescriptionSays) {
  const std::vector<Described> described = describedMethods(wire::kReplyInterface);
  ASSERT_EQ(described.size(), 1U);
  EXPECT_EQ(wire::kSendMessageToClient, described[0].member);
  EXPECT_EQ(wire::kSendMessageToClientSignature, described[0].in);
  EXPECT_EQ(described[0].out, "");
}

}  // namespace
}  // namespace kyt
