/*
 * The bare minimum of giving records to NATS: one program that publishes as fast as JetStream confirms. Says on standard
 * output how many MB a second that were.
 *
 *   nats_publisher URL BYTES SECONDS
 */
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <nats/nats.h>
#include <string>

namespace
{

void must(natsStatus status)
{
    if (status == NATS_OK)
        return;
    std::fprintf(stderr, "nats_publisher: %s\n", natsStatus_GetText(status));
    std::exit(1);
}

/* Publishes for some seconds, at most 256 records ahead of what is confirmed. */
void publish(jsCtx *stream, const std::string &record, std::chrono::seconds time)
{
    const auto begun = std::chrono::steady_clock::now();
    double bytes = 0;
    for (unsigned i = 0; std::chrono::steady_clock::now() < begun + time; ++i) {
        const std::string subject = "bench." + std::to_string(i % 200);
        must(js_PublishAsync(stream, subject.c_str(), record.data(), static_cast<int>(record.size()), nullptr));
        bytes += static_cast<double>(record.size());
    }
    must(js_PublishAsyncComplete(stream, nullptr));
    const std::chrono::duration<double> took = std::chrono::steady_clock::now() - begun;
    std::printf("%.1f\n", bytes / took.count() / 1e6);
}

} // namespace

int main(int argc, char **argv)
{
    if (argc != 4)
        return 2;
    natsConnection *connection = nullptr;
    jsCtx *stream = nullptr;
    jsOptions options;
    jsOptions_Init(&options);
    options.PublishAsync.MaxPending = 256;
    must(natsConnection_ConnectTo(&connection, argv[1]));
    must(natsConnection_JetStream(&stream, connection, &options));
    const char *subjects[] = {"bench.>"};
    jsStreamConfig config;
    jsStreamConfig_Init(&config);
    config.Name = "bench";
    config.Subjects = subjects;
    config.SubjectsLen = 1;
    must(js_AddStream(nullptr, stream, &config, nullptr, nullptr));
    publish(stream, std::string(static_cast<std::size_t>(std::atoi(argv[2])), '.'),
            std::chrono::seconds(std::atoi(argv[3])));
    must(js_DeleteStream(stream, "bench", nullptr, nullptr));
    jsCtx_Destroy(stream);
    natsConnection_Destroy(connection);
    nats_Close();
}
