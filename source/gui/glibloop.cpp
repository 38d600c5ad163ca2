#include "nxbase/glibloop.h"

#include "toolkit/application.h"

namespace nxbase::glib {

namespace {

struct LoopSource {
    GSource source;
    gpointer tag;  // the loop descriptor's entry
};

GSource* gAttached = nullptr;
GMainContext* gContext = nullptr;
std::uint64_t gWakeUps = 0;

// Before GLib sleeps: handlers made ready by calls outside any handler (a
// GTK signal that sent a message) are not announced on the descriptor. GLib
// must not be iterated from here, so a handler that waits runs the
// library's loop alone until it returns.
gboolean Prepare(GSource*, gint* timeout) {
    *timeout = -1;
    Application::Get().DispatchWithoutNesting();
    return FALSE;
}

gboolean Check(GSource* source) {
    auto* loop = reinterpret_cast<LoopSource*>(source);
    return (g_source_query_unix_fd(source, loop->tag) & G_IO_IN) != 0;
}

gboolean Dispatch(GSource*, GSourceFunc, gpointer) {
    ++gWakeUps;
    Application::Get().Dispatch();
    return G_SOURCE_CONTINUE;
}

GSourceFuncs gFuncs = {Prepare, Check, Dispatch, nullptr, nullptr, nullptr};

// One turn of the context, for at most `timeout`: a short timeout source
// bounds the sleep, so the library's wait can ask its keep-waiting function.
void IterateOnce(std::chrono::milliseconds timeout) {
    GSource* limit = g_timeout_source_new(static_cast<guint>(timeout.count()));
    g_source_set_callback(
        limit, [](gpointer) -> gboolean { return G_SOURCE_REMOVE; }, nullptr, nullptr);
    g_source_attach(limit, gContext);
    g_main_context_iteration(gContext, TRUE);
    g_source_destroy(limit);
    g_source_unref(limit);
}

}  // namespace

guint Attach(GMainContext* context) {
    Detach();
    int descriptor = Application::Get().GetLoopDescriptor();
    GSource* source = g_source_new(&gFuncs, sizeof(LoopSource));
    auto* loop = reinterpret_cast<LoopSource*>(source);
    loop->tag = g_source_add_unix_fd(source, descriptor, G_IO_IN);
    // A handler may wait for an answer, which iterates the context again.
    g_source_set_can_recurse(source, TRUE);
    g_source_set_name(source, "nxbase loop");
    gContext = context != nullptr ? context : g_main_context_default();
    g_main_context_ref(gContext);
    guint id = g_source_attach(source, gContext);
    gAttached = source;
    gWakeUps = 0;
    Application::Get().SetNestedWait(IterateOnce);
    return id;
}

void Detach() {
    if (gAttached == nullptr) return;
    Application::Get().SetNestedWait({});
    g_source_destroy(gAttached);
    g_source_unref(gAttached);
    gAttached = nullptr;
    g_main_context_unref(gContext);
    gContext = nullptr;
}

std::uint64_t WakeUps() {
    return gWakeUps;
}

}  // namespace nxbase::glib
