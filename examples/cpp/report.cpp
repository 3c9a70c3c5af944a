// A reporting session from C++: connect, describe the session, start it,
// send a few events and finish, with the blocking forms of the calls (each
// waits for its answer at most 5 s).
#include <zerith/Zerith.h>

#include <chrono>
#include <iostream>

int main() {
  using namespace std::chrono_literals;
  zerith::Error error;
  const auto session = zerith::Zerith::connect({}, &error);  // {}: the default socket
  if (!session) {
    std::cerr << "report: " << error.description << '\n';
    return 1;
  }
  const zerith::Dictionary info{{kZerithSessionInfoClientType, 7}, {kZerithSessionInfoSessionID, 1}};
  zerith::ZerithReply reply = session->setSessionInfo(info, nullptr, nullptr, false, 5s);
  if (reply) {
    reply = session->startConfig(5s);  // "backends": absent until the device has a storebag
    std::cout << "start: " << reply["backends"].description() << '\n';
  }
  for (int i = 0; reply && i < 3; ++i) {
    reply = session->sendMessage(zerith::Dictionary{{kZerithMessageParametersCategory, 1},
                                                    {kZerithMessageParametersType, 2},
                                                    {kZerithMessageParametersPayload, zerith::Dictionary{{"n", i}}}},
                                 5s);
    std::cout << "send: " << reply["result"].description() << '\n';
  }
  if (reply) {
    reply = session->finishSession(5s);
  }
  if (!reply) {
    std::cerr << "report: " << reply.error->description << '\n';
    return 1;
  }
}
