cat > hello.cpp <<'END'
#include <kytreporting/KYTReporting.h>

int main() {
  kyt::KYTReporting::Options options;
  options.sessionInfo = kyt::SessionInfo{.clientType = 20};
  options.userInfo = kyt::Dictionary{{"ClientName", "hello"}, {"ServiceName", "demo"}};
  const auto session = kyt::KYTReporting::open(std::move(options));
  session->startConfiguration();
  session->sendMessage(10, 1, {{"step", 1}});
  return session->finish() ? 0 : 1;
}
END
c++ -std=c++20 hello.cpp $(pkg-config --cflags --libs kytreporting) -o hello
kytdemo --stage -- ./hello
