#include "QVBridgeGraph.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstring>
#include <map>
#include <set>

#include <pipewire/extensions/profiler.h>
#include <pipewire/impl-module.h>
#include <pipewire/pipewire.h>
#include <spa/param/param.h>
#include <spa/utils/dict.h>
#include <spa/utils/result.h>

#include "QVBridgeLog.h"
#include "QVBridgeMapping.h"
#include "QVBridgePods.h"

namespace qv::bridge {

namespace {

using Clock = std::chrono::steady_clock;

// Param and state changes of one stream arrive as several events; they are reported together
// once this long has passed without another.
constexpr std::uint64_t kSettleNanoseconds = 20'000'000;
// Xruns of a stream are reported at most once a second each, with their count.
constexpr auto kXrunReportInterval = std::chrono::seconds(1);
// Profiled cycles of a stream on a new driver that are not taken for xruns.
constexpr std::uint32_t kJoiningCycles = 4;

void mergeProps(QVBridgeProps& into, const spa_dict* dict) {
    if (dict == nullptr) {
        return;
    }
    const spa_dict_item* item;
    spa_dict_for_each(item, dict) {
        if (item->key != nullptr && item->value != nullptr) {
            into[item->key] = item->value;
        }
    }
}

std::string lookup(const QVBridgeProps& props, std::string_view key) {
    const auto it = props.find(key);
    return it == props.end() ? std::string() : it->second;
}

std::uint32_t lookupID(const QVBridgeProps& props, std::string_view key) {
    const std::string text = lookup(props, key);
    if (text.empty()) {
        return SPA_ID_INVALID;
    }
    try {
        return static_cast<std::uint32_t>(std::stoul(text));
    } catch (const std::exception&) {
        return SPA_ID_INVALID;
    }
}

void setTimer(pw_loop* loop, spa_source* timer, std::uint64_t nanoseconds, bool repeat) {
    timespec value{static_cast<time_t>(nanoseconds / 1'000'000'000),
                   static_cast<long>(nanoseconds % 1'000'000'000)};
    timespec interval = repeat ? value : timespec{0, 0};
    pw_loop_update_timer(loop, timer, &value, &interval, false);
}

}  // namespace

struct QVBridgeGraph::Impl {
    struct Node {
        Impl* impl = nullptr;
        std::uint32_t id = 0;
        QVBridgeProps props;
        bool stream = false;
        bool output = true;
        pw_proxy* proxy = nullptr;
        spa_hook objectListener{};
        pw_node_state state = PW_NODE_STATE_SUSPENDED;
        // The registry's properties of a node leave out application.id and others: a stream is
        // reported only once its info has come.
        bool infoKnown = false;
        std::optional<std::vector<float>> channelVolumes;
        bool mute = false;
        std::optional<QVBridgeFormatParam> format;
        // Xruns not yet reported, and what the last cycle said of its driver.
        std::uint64_t pendingXruns = 0;
        std::uint32_t quantum = 0;
        std::string driver;
        std::uint32_t driverID = SPA_ID_INVALID;
        std::uint32_t cyclesOnDriver = 0;
        Clock::time_point lastXrunReport{};
    };
    struct Client {
        Impl* impl = nullptr;
        std::uint32_t id = 0;
        QVBridgeProps props;
        bool infoKnown = false;  // the process binary comes with the info
        pw_proxy* proxy = nullptr;
        spa_hook objectListener{};
    };
    struct Link {
        std::uint32_t outputNode = SPA_ID_INVALID;
        std::uint32_t inputNode = SPA_ID_INVALID;
    };

    QVBridgeEventQueue& queue;
    QVBridgeStats& stats;
    QVBridgeReporter& reporter;
    const Options options;

    pw_main_loop* mainLoop = nullptr;
    pw_loop* loop = nullptr;
    pw_context* context = nullptr;
    pw_core* core = nullptr;
    spa_hook coreListener{};
    pw_registry* registry = nullptr;
    spa_hook registryListener{};
    pw_proxy* profiler = nullptr;
    spa_hook profilerListener{};
    spa_source* settleTimer = nullptr;
    spa_source* tickTimer = nullptr;
    spa_source* teardownTimer = nullptr;
    bool settleArmed = false;
    bool everConnected = false;

    std::map<std::uint32_t, std::unique_ptr<Node>> nodes;
    std::map<std::uint32_t, std::unique_ptr<Client>> clients;
    std::map<std::uint32_t, QVBridgeProps> devices;
    std::map<std::uint32_t, Link> links;
    std::set<std::uint32_t> dirty;
    std::map<std::uint32_t, std::int32_t> driverXruns;  // each driver's last xrun count

    Impl(QVBridgeEventQueue& q, QVBridgeStats& s, QVBridgeReporter& r, Options o)
        : queue(q), stats(s), reporter(r), options(std::move(o)) {}

    void push(std::vector<QVBridgeEvent> events) {
        for (auto& e : events) {
            if (QVBridgeLogEnabled(QVBridgeLogLevel::kDebug)) {
                QVBridgeLog(QVBridgeLogLevel::kDebug, "event {}", QVBridgeEventJson(e));
            }
            if (!queue.push(std::move(e)) && stats.eventsDropped() % 1000 == 1) {
                QVBridgeLog(QVBridgeLogLevel::kError,
                            "the queue to the daemon is full: {} events dropped so far",
                            stats.eventsDropped());
            }
        }
    }

    // --- Connection ------------------------------------------------------------------------

    bool connect() {
        pw_properties* props = nullptr;
        if (!options.remote.empty()) {
            props = pw_properties_new(PW_KEY_REMOTE_NAME, options.remote.c_str(), nullptr);
        }
        core = pw_context_connect(context, props, 0);
        if (core == nullptr) {
            return false;
        }
        static const pw_core_events coreEvents = {
            .version = PW_VERSION_CORE_EVENTS,
            .error = onCoreError,
        };
        pw_core_add_listener(core, &coreListener, &coreEvents, this);
        registry = pw_core_get_registry(core, PW_VERSION_REGISTRY, 0);
        static const pw_registry_events registryEvents = {
            .version = PW_VERSION_REGISTRY_EVENTS,
            .global = onGlobal,
            .global_remove = onGlobalRemove,
        };
        pw_registry_add_listener(registry, &registryListener, &registryEvents, this);
        if (everConnected) {
            stats.notePipeWireReconnect();
            QVBridgeLog(QVBridgeLogLevel::kInfo, "reconnected to PipeWire");
        } else {
            QVBridgeLog(QVBridgeLogLevel::kInfo, "connected to PipeWire{}",
                        options.remote.empty() ? "" : " remote " + options.remote);
        }
        everConnected = true;
        return true;
    }

    // Drops every proxy and record; the sessions of the streams close.
    void disconnect() {
        push(reporter.removeAll());
        for (auto& [id, node] : nodes) {
            destroyProxy(node->proxy, node->objectListener);
        }
        for (auto& [id, client] : clients) {
            destroyProxy(client->proxy, client->objectListener);
        }
        destroyProxy(profiler, profilerListener);
        nodes.clear();
        clients.clear();
        devices.clear();
        links.clear();
        dirty.clear();
        driverXruns.clear();
        if (registry != nullptr) {
            spa_hook_remove(&registryListener);
            pw_proxy_destroy(reinterpret_cast<pw_proxy*>(registry));
            registry = nullptr;
        }
        if (core != nullptr) {
            spa_hook_remove(&coreListener);
            pw_core_disconnect(core);
            core = nullptr;
        }
    }

    static void destroyProxy(pw_proxy*& proxy, spa_hook& listener) {
        if (proxy != nullptr) {
            spa_hook_remove(&listener);
            pw_proxy_destroy(proxy);
            proxy = nullptr;
        }
    }

    static void onCoreError(void* data, std::uint32_t id, int /*seq*/, int res,
                            const char* message) {
        auto* self = static_cast<Impl*>(data);
        if (id == PW_ID_CORE && res == -EPIPE) {
            QVBridgeLog(QVBridgeLogLevel::kInfo,
                        "PipeWire went away: closing {} sessions, reconnecting",
                        self->reporter.size());
            // Not from inside the core's own callback: the teardown destroys the core.
            setTimer(self->loop, self->teardownTimer, 1, false);
        } else {
            QVBridgeLog(QVBridgeLogLevel::kDebug, "PipeWire error on {}: {} ({})", id,
                        message != nullptr ? message : "", spa_strerror(res));
        }
    }

    static void onTeardown(void* data, std::uint64_t) {
        auto* self = static_cast<Impl*>(data);
        self->disconnect();
    }

    // Every second: reconnect when PipeWire is away, report pending xruns.
    static void onTick(void* data, std::uint64_t) {
        auto* self = static_cast<Impl*>(data);
        if (self->core == nullptr) {
            self->connect();
            return;
        }
        self->reportXruns(false);
    }

    // --- Registry -----------------------------------------------------------------------------

    static void onGlobal(void* data, std::uint32_t id, std::uint32_t /*permissions*/,
                         const char* type, std::uint32_t /*version*/, const spa_dict* props) {
        auto* self = static_cast<Impl*>(data);
        if (std::strcmp(type, PW_TYPE_INTERFACE_Node) == 0) {
            self->addNode(id, props);
        } else if (std::strcmp(type, PW_TYPE_INTERFACE_Link) == 0) {
            QVBridgeProps p;
            mergeProps(p, props);
            Link link{lookupID(p, PW_KEY_LINK_OUTPUT_NODE), lookupID(p, PW_KEY_LINK_INPUT_NODE)};
            self->links[id] = link;
            self->touchLinked(link);
        } else if (std::strcmp(type, PW_TYPE_INTERFACE_Device) == 0) {
            mergeProps(self->devices[id], props);
        } else if (std::strcmp(type, PW_TYPE_INTERFACE_Client) == 0) {
            self->addClient(id, props);
        } else if (std::strcmp(type, PW_TYPE_INTERFACE_Profiler) == 0 &&
                   self->profiler == nullptr) {
            self->profiler = static_cast<pw_proxy*>(
                pw_registry_bind(self->registry, id, type, PW_VERSION_PROFILER, 0));
            if (self->profiler != nullptr) {
                static const pw_profiler_events profilerEvents = {
                    .version = PW_VERSION_PROFILER_EVENTS,
                    .profile = onProfile,
                };
                pw_proxy_add_object_listener(self->profiler, &self->profilerListener,
                                             &profilerEvents, self);
            }
        }
    }

    static void onGlobalRemove(void* data, std::uint32_t id) {
        auto* self = static_cast<Impl*>(data);
        if (auto it = self->nodes.find(id); it != self->nodes.end()) {
            if (it->second->stream) {
                self->dirty.erase(id);
                self->push(self->reporter.remove(id));
            }
            destroyProxy(it->second->proxy, it->second->objectListener);
            self->nodes.erase(it);
            // Streams linked to it are told by the links' removal.
        } else if (auto link = self->links.find(id); link != self->links.end()) {
            const Link gone = link->second;
            self->links.erase(link);
            self->touchLinked(gone);
        } else if (auto client = self->clients.find(id); client != self->clients.end()) {
            destroyProxy(client->second->proxy, client->second->objectListener);
            self->clients.erase(client);
        } else {
            self->devices.erase(id);
        }
    }

    void addNode(std::uint32_t id, const spa_dict* props) {
        auto node = std::make_unique<Node>();
        node->impl = this;
        node->id = id;
        mergeProps(node->props, props);
        const std::string mediaClass = lookup(node->props, PW_KEY_MEDIA_CLASS);
        node->stream = mediaClass == "Stream/Output/Audio" || mediaClass == "Stream/Input/Audio";
        node->output = mediaClass == "Stream/Output/Audio";
        if (node->stream) {
            node->proxy = static_cast<pw_proxy*>(
                pw_registry_bind(registry, id, PW_TYPE_INTERFACE_Node, PW_VERSION_NODE, 0));
            if (node->proxy != nullptr) {
                static const pw_node_events nodeEvents = {
                    .version = PW_VERSION_NODE_EVENTS,
                    .info = onNodeInfo,
                    .param = onNodeParam,
                };
                pw_proxy_add_object_listener(node->proxy, &node->objectListener, &nodeEvents,
                                             node.get());
                std::uint32_t ids[] = {SPA_PARAM_Props, SPA_PARAM_Format};
                pw_node_subscribe_params(reinterpret_cast<pw_node*>(node->proxy), ids, 2);
            }
            markDirty(id);
        }
        nodes[id] = std::move(node);
    }

    void addClient(std::uint32_t id, const spa_dict* props) {
        auto client = std::make_unique<Client>();
        client->impl = this;
        client->id = id;
        mergeProps(client->props, props);
        // The global's properties leave out the process binary; the client's info has it.
        client->proxy = static_cast<pw_proxy*>(
            pw_registry_bind(registry, id, PW_TYPE_INTERFACE_Client, PW_VERSION_CLIENT, 0));
        if (client->proxy != nullptr) {
            static const pw_client_events clientEvents = {
                .version = PW_VERSION_CLIENT_EVENTS,
                .info = onClientInfo,
            };
            pw_proxy_add_object_listener(client->proxy, &client->objectListener, &clientEvents,
                                         client.get());
        }
        clients[id] = std::move(client);
    }

    static void onClientInfo(void* data, const pw_client_info* info) {
        auto* client = static_cast<Client*>(data);
        mergeProps(client->props, info->props);
        client->infoKnown = true;
        // Streams of this client may now find their application's ID.
        for (auto& [id, node] : client->impl->nodes) {
            if (node->stream && lookupID(node->props, PW_KEY_CLIENT_ID) == client->id) {
                client->impl->markDirty(id);
            }
        }
    }

    static void onNodeInfo(void* data, const pw_node_info* info) {
        auto* node = static_cast<Node*>(data);
        if ((info->change_mask & PW_NODE_CHANGE_MASK_PROPS) != 0) {
            mergeProps(node->props, info->props);
            node->infoKnown = true;
        }
        if ((info->change_mask & PW_NODE_CHANGE_MASK_STATE) != 0) {
            node->state = info->state;
        }
        node->impl->markDirty(node->id);
    }

    static void onNodeParam(void* data, int /*seq*/, std::uint32_t id, std::uint32_t /*index*/,
                            std::uint32_t /*next*/, const spa_pod* param) {
        auto* node = static_cast<Node*>(data);
        if (id == SPA_PARAM_Props) {
            const QVBridgePropsParam props = QVBridgeParseProps(param);
            if (props.channelVolumes) {
                node->channelVolumes = props.channelVolumes;
            }
            if (props.mute) {
                node->mute = *props.mute;
            }
        } else if (id == SPA_PARAM_Format) {
            node->format = QVBridgeParseFormat(param);
        }
        node->impl->markDirty(node->id);
    }

    // --- Streams ------------------------------------------------------------------------------

    void markDirty(std::uint32_t id) {
        dirty.insert(id);
        if (!settleArmed) {
            settleArmed = true;
            setTimer(loop, settleTimer, kSettleNanoseconds, false);
        }
    }

    void touchLinked(const Link& link) {
        for (std::uint32_t id : {link.outputNode, link.inputNode}) {
            if (auto it = nodes.find(id); it != nodes.end() && it->second->stream) {
                markDirty(id);
            }
        }
    }

    static void onSettled(void* data, std::uint64_t) {
        auto* self = static_cast<Impl*>(data);
        self->settleArmed = false;
        const std::set<std::uint32_t> ready = std::move(self->dirty);
        self->dirty.clear();
        for (std::uint32_t id : ready) {
            if (auto it = self->nodes.find(id);
                it != self->nodes.end() && self->ready(*it->second)) {
                self->push(self->reporter.update(self->snapshot(*it->second)));
            }
        }
    }

    // Its properties and its client's are complete (a client not bound is not waited for).
    bool ready(const Node& node) const {
        const auto client = clients.find(lookupID(node.props, PW_KEY_CLIENT_ID));
        return node.infoKnown && (client == clients.end() || client->second->proxy == nullptr ||
                                  client->second->infoKnown);
    }

    // What the stream plays to (output) or records from (input): the first link's other end.
    std::string deviceOf(const Node& stream) const {
        for (const auto& [id, link] : links) {
            const std::uint32_t peer =
                stream.output ? (link.outputNode == stream.id ? link.inputNode : SPA_ID_INVALID)
                              : (link.inputNode == stream.id ? link.outputNode : SPA_ID_INVALID);
            if (peer == SPA_ID_INVALID) {
                continue;
            }
            const auto node = nodes.find(peer);
            if (node == nodes.end()) {
                continue;
            }
            static const QVBridgeProps kNone;
            const auto device = devices.find(lookupID(node->second->props, PW_KEY_DEVICE_ID));
            return QVBridgeDeviceKind(node->second->props,
                                      device == devices.end() ? kNone : device->second);
        }
        return "unknown";
    }

    QVBridgeStreamState snapshot(const Node& node) const {
        static const QVBridgeProps kNone;
        QVBridgeStreamState s;
        s.nodeID = node.id;
        s.output = node.output;
        s.role = lookup(node.props, PW_KEY_MEDIA_ROLE);
        const auto client = clients.find(lookupID(node.props, PW_KEY_CLIENT_ID));
        s.applicationID = QVBridgeApplicationID(
            node.props, client == clients.end() ? kNone : client->second->props);
        s.nodeName = lookup(node.props, PW_KEY_NODE_NAME);
        s.running = node.state == PW_NODE_STATE_RUNNING;
        if (node.channelVolumes) {
            s.volume = QVBridgeSessionVolume(*node.channelVolumes, node.mute);
        }
        s.device = deviceOf(node);
        if (node.format) {
            s.format = QVBridgeFormatText(node.format->sampleFormat, node.format->rate,
                                          node.format->channels);
            s.sampleFormat = node.format->sampleFormat;
            s.channels = node.format->channels;
        }
        return s;
    }

    // --- Xruns --------------------------------------------------------------------------------

    static void onProfile(void* data, const spa_pod* pod) {
        auto* self = static_cast<Impl*>(data);
        for (const QVBridgeProfilerCycle& cycle : QVBridgeParseProfile(pod)) {
            std::int32_t& last = self->driverXruns[cycle.driverID];
            const bool driverXrun = cycle.xrunCount > last;
            last = cycle.xrunCount;
            for (const auto& follower : cycle.followers) {
                auto it = self->nodes.find(follower.id);
                if (it == self->nodes.end() || !it->second->stream) {
                    continue;
                }
                Node& node = *it->second;
                node.quantum = cycle.quantum;
                node.driver = cycle.driverName;
                if (node.driverID != cycle.driverID) {
                    node.driverID = cycle.driverID;
                    node.cyclesOnDriver = 0;
                }
                // The first cycles on a new driver (a start, a move) may find the stream not yet
                // scheduled; that is joining, not overrunning.
                if (++node.cyclesOnDriver <= kJoiningCycles) {
                    continue;
                }
                if (driverXrun || follower.status != kQVBridgeNodeFinished) {
                    ++node.pendingXruns;
                }
            }
        }
        self->reportXruns(true);
    }

    // Reports the xruns of each stream at most once per interval; all of them when not `due`.
    void reportXruns(bool onlyDue) {
        const auto now = Clock::now();
        for (auto& [id, node] : nodes) {
            if (node->pendingXruns == 0 ||
                (onlyDue && now - node->lastXrunReport < kXrunReportInterval)) {
                continue;
            }
            push(reporter.xruns(id, node->pendingXruns, node->quantum, node->driver));
            node->pendingXruns = 0;
            node->lastXrunReport = now;
        }
    }

    static void onSignal(void* data, int /*signal*/) {
        pw_main_loop_quit(static_cast<Impl*>(data)->mainLoop);
    }
};

QVBridgeGraph::QVBridgeGraph(QVBridgeEventQueue& queue, QVBridgeStats& stats,
                             QVBridgeReporter& reporter, Options options)
    : impl_(std::make_unique<Impl>(queue, stats, reporter, std::move(options))) {
    Impl& d = *impl_;
    d.mainLoop = pw_main_loop_new(nullptr);
    d.loop = pw_main_loop_get_loop(d.mainLoop);
    d.context = pw_context_new(d.loop, nullptr, 0);
    // The profiler's protocol marshalling lives in its module: without it the bind fails.
    if (pw_context_load_module(d.context, PW_EXTENSION_MODULE_PROFILER, nullptr, nullptr) ==
        nullptr) {
        QVBridgeLog(QVBridgeLogLevel::kError, "no profiler module here: xruns are not reported");
    }
    d.settleTimer = pw_loop_add_timer(d.loop, Impl::onSettled, &d);
    d.tickTimer = pw_loop_add_timer(d.loop, Impl::onTick, &d);
    d.teardownTimer = pw_loop_add_timer(d.loop, Impl::onTeardown, &d);
    pw_loop_add_signal(d.loop, SIGINT, Impl::onSignal, &d);
    pw_loop_add_signal(d.loop, SIGTERM, Impl::onSignal, &d);
}

QVBridgeGraph::~QVBridgeGraph() {
    Impl& d = *impl_;
    d.disconnect();
    pw_context_destroy(d.context);
    pw_main_loop_destroy(d.mainLoop);
}

void QVBridgeGraph::run() {
    Impl& d = *impl_;
    if (!d.connect()) {
        QVBridgeLog(QVBridgeLogLevel::kError,
                    "cannot connect to PipeWire ({}); trying every second", std::strerror(errno));
    }
    setTimer(d.loop, d.tickTimer, 1'000'000'000, true);
    pw_main_loop_run(d.mainLoop);
    // Every session stops now, so the daemon derives what the streams played.
    d.reportXruns(false);
    d.push(d.reporter.removeAll());
}

void QVBridgeGraph::quit() {
    pw_main_loop_quit(impl_->mainLoop);
}

}  // namespace qv::bridge
