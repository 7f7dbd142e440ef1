// A PipeWire client for the bridge's tests and benchmark: N playback streams of a quiet tone that
// optionally change their own volume R times a second, or overrun their cycle (the process
// callback takes longer than the quantum, so the graph's driver sees xruns).
//   qv_bridge_test_streams [--streams N] [--seconds S] [--volume-rate R] [--overrun] [--app-id ID]
#include <unistd.h>

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include <pipewire/pipewire.h>
#include <spa/param/audio/format-utils.h>
#include <spa/param/props.h>

namespace {

constexpr std::uint32_t kRate = 48000;
constexpr std::uint32_t kChannels = 2;

struct Options {
    int streams = 1;
    double seconds = 5;
    double volumeRate = 0;
    bool overrun = false;
    std::string appID = "qv-test-streams";
};

struct Stream {
    pw_stream* stream = nullptr;
    spa_hook listener{};
    double phase = 0;
    bool overrun = false;
};

struct App {
    Options options;
    pw_main_loop* loop = nullptr;
    std::vector<std::unique_ptr<Stream>> streams;
    unsigned tick = 0;
};

void onProcess(void* data) {
    auto* s = static_cast<Stream*>(data);
    pw_buffer* b = pw_stream_dequeue_buffer(s->stream);
    if (b == nullptr) {
        return;
    }
    spa_buffer* buf = b->buffer;
    auto* out = static_cast<float*>(buf->datas[0].data);
    if (out == nullptr) {
        pw_stream_queue_buffer(s->stream, b);
        return;
    }
    const std::uint32_t stride = sizeof(float) * kChannels;
    std::uint32_t frames = buf->datas[0].maxsize / stride;
    if (b->requested != 0 && b->requested < frames) {
        frames = static_cast<std::uint32_t>(b->requested);
    }
    for (std::uint32_t i = 0; i < frames; ++i) {
        const float v = 0.05f * static_cast<float>(std::sin(s->phase));
        s->phase += 2 * M_PI * 440 / kRate;
        for (std::uint32_t c = 0; c < kChannels; ++c) {
            *out++ = v;
        }
    }
    if (s->overrun) {
        // Twice the cycle's length: the driver's next cycle finds this one unfinished.
        usleep(static_cast<useconds_t>(2'000'000.0 * frames / kRate));
    }
    buf->datas[0].chunk->offset = 0;
    buf->datas[0].chunk->stride = stride;
    buf->datas[0].chunk->size = frames * stride;
    pw_stream_queue_buffer(s->stream, b);
}

void onVolumeTick(void* data, std::uint64_t) {
    auto* app = static_cast<App*>(data);
    ++app->tick;
    for (std::size_t i = 0; i < app->streams.size(); ++i) {
        const float level = ((app->tick + i) % 2 == 0) ? 0.8f : 0.3f;
        float volumes[kChannels];
        for (float& v : volumes) {
            v = level * level * level;
        }
        pw_stream_set_control(app->streams[i]->stream, SPA_PROP_channelVolumes, kChannels, volumes,
                              0);
    }
}

void onDone(void* data, std::uint64_t) {
    pw_main_loop_quit(static_cast<App*>(data)->loop);
}

void setTimer(pw_loop* loop, spa_source* timer, double seconds, bool repeat) {
    timespec value{static_cast<time_t>(seconds), static_cast<long>(std::fmod(seconds, 1.0) * 1e9)};
    timespec interval = repeat ? value : timespec{0, 0};
    pw_loop_update_timer(loop, timer, &value, &interval, false);
}

}  // namespace

int main(int argc, char** argv) {
    App app;
    Options& o = app.options;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        const bool hasValue = i + 1 < argc;
        if (arg == "--streams" && hasValue) {
            o.streams = std::atoi(argv[++i]);
        } else if (arg == "--seconds" && hasValue) {
            o.seconds = std::atof(argv[++i]);
        } else if (arg == "--volume-rate" && hasValue) {
            o.volumeRate = std::atof(argv[++i]);
        } else if (arg == "--overrun") {
            o.overrun = true;
        } else if (arg == "--app-id" && hasValue) {
            o.appID = argv[++i];
        } else {
            std::fprintf(stderr,
                         "usage: %s [--streams N] [--seconds S] [--volume-rate R] [--overrun] "
                         "[--app-id ID]\n",
                         argv[0]);
            return 2;
        }
    }

    pw_init(&argc, &argv);
    app.loop = pw_main_loop_new(nullptr);
    pw_loop* loop = pw_main_loop_get_loop(app.loop);

    static const pw_stream_events events = {
        .version = PW_VERSION_STREAM_EVENTS,
        .process = onProcess,
    };
    for (int i = 0; i < o.streams; ++i) {
        auto s = std::make_unique<Stream>();
        s->overrun = o.overrun;
        pw_properties* props = pw_properties_new(
            PW_KEY_MEDIA_TYPE, "Audio", PW_KEY_MEDIA_CATEGORY, "Playback", PW_KEY_MEDIA_ROLE,
            "Music", PW_KEY_APP_ID, o.appID.c_str(), PW_KEY_NODE_LATENCY, "1024/48000", nullptr);
        const std::string name = o.appID + "-" + std::to_string(i);
        s->stream = pw_stream_new_simple(loop, name.c_str(), props, &events, s.get());
        std::uint8_t buffer[1024];
        spa_pod_builder b = SPA_POD_BUILDER_INIT(buffer, sizeof(buffer));
        spa_audio_info_raw info{};
        info.format = SPA_AUDIO_FORMAT_F32;
        info.rate = kRate;
        info.channels = kChannels;
        info.position[0] = SPA_AUDIO_CHANNEL_FL;
        info.position[1] = SPA_AUDIO_CHANNEL_FR;
        const spa_pod* params[1] = {spa_format_audio_raw_build(&b, SPA_PARAM_EnumFormat, &info)};
        const auto flags = static_cast<pw_stream_flags>(
            PW_STREAM_FLAG_AUTOCONNECT | PW_STREAM_FLAG_MAP_BUFFERS | PW_STREAM_FLAG_RT_PROCESS);
        if (pw_stream_connect(s->stream, PW_DIRECTION_OUTPUT, PW_ID_ANY, flags, params, 1) < 0) {
            std::fprintf(stderr, "cannot connect stream %d\n", i);
            return 1;
        }
        app.streams.push_back(std::move(s));
    }
    spa_source* done = pw_loop_add_timer(loop, onDone, &app);
    setTimer(loop, done, o.seconds, false);
    if (o.volumeRate > 0) {
        spa_source* volume = pw_loop_add_timer(loop, onVolumeTick, &app);
        setTimer(loop, volume, 1.0 / o.volumeRate, true);
    }
    pw_main_loop_run(app.loop);
    for (auto& s : app.streams) {
        pw_stream_destroy(s->stream);
    }
    pw_main_loop_destroy(app.loop);
    pw_deinit();
    return 0;
}
