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
gint64 gNestedDeadline = -1;  // the end of a nested wait's turn, monotonic µs

// Before GLib sleeps: handlers made ready by calls outside any handler (a
// GTK signal that sent a message, or an answer that came while the message
// was written) are not announced on the descriptor. When some ran here the
// source counts as ready, so that the iteration returns instead of sleeping
// (a nested wait is then over at once). GLib must not be iterated from
// here, so a handler that waits runs the library's loop alone meanwhile.
gboolean Prepare(GSource*, gint* timeout) {
    *timeout = -1;
    if (gNestedDeadline >= 0) {
        gint64 left = gNestedDeadline - g_get_monotonic_time();
        *timeout = left > 0 ? static_cast<gint>((left + 999) / 1000) : 0;
    }
    return Application::Get().DispatchWithoutNesting() > 0;
}

gboolean Check(GSource* source) {
    auto* loop = reinterpret_cast<LoopSource*>(source);
    bool readable = (g_source_query_unix_fd(source, loop->tag) & G_IO_IN) != 0;
    if (readable) ++gWakeUps;
    return readable;
}

gboolean Dispatch(GSource*, GSourceFunc, gpointer) {
    Application::Get().Dispatch();
    return G_SOURCE_CONTINUE;
}

GSourceFuncs gFuncs = {Prepare, Check, Dispatch, nullptr, nullptr, nullptr};

// One turn of the context, for at most `timeout`, so that the library's
// wait can ask its keep-waiting function. The source's prepare bounds the
// poll by the deadline; no source is made for it.
void IterateOnce(std::chrono::milliseconds timeout) {
    gint64 outer = gNestedDeadline;
    gNestedDeadline = g_get_monotonic_time() + timeout.count() * 1000;
    g_main_context_iteration(gContext, TRUE);
    gNestedDeadline = outer;
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
