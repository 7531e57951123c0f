#include "BufferedLogResponder.h"

#include <errno.h>
#include <time.h>

#include "kelvo/BufferedLogClient.h"

namespace kelvo {
namespace sim {

namespace {

constexpr int kReceiveWaitMs = 200;
constexpr int64_t kReconnectMs = 500;

}  // namespace

void BufferedLogResponder::serve(const char* name, const std::atomic<bool>& stop,
                                 const Answer& answer, const std::function<void()>& sent) {
    BufferedLogClient client;
    bool connected = false;
    while (!stop) {
        if (!connected) {
            connected = client.connect(name) == 0;
            if (!connected) {
                struct timespec ts = {0, static_cast<long>(kReconnectMs) * 1000000};
                nanosleep(&ts, nullptr);
                continue;
            }
        }
        int32_t magic = 0;
        std::string data;
        if (client.receive(&magic, &data, kReceiveWaitMs) != 0) {
            if (errno != ETIMEDOUT) {
                client.close();
                connected = false;
            }
            continue;
        }
        int32_t replyMagic = magic;
        std::string reply;
        if (!answer(magic, data, &replyMagic, &reply)) {
            continue;
        }
        if (client.send(replyMagic, reply) != 0) {
            client.close();
            connected = false;
            continue;
        }
        if (sent) {
            sent();
        }
    }
    client.close();
}

}  // namespace sim
}  // namespace kelvo
