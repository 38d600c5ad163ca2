// Runs the library's event loop inside a GLib main loop (library
// nxbase-glib): a GSource watches the loop descriptor and dispatches the
// library's handlers when it is readable, so an idle application sleeps and
// a message is handled as soon as its socket is readable; and the library's
// waits (a blocking SendAndReceive, a server being started) iterate the GLib
// context, so the rest of the program keeps running meanwhile.
//
//     nxbase::glib::Attach();           // before or after CreatePostOffice
//     g_main_loop_run(loop);            // instead of Application::Execute()
//
// Everything runs on the thread that iterates the context. One limit: GLib
// may not be iterated while it prepares a turn, and the source dispatches
// there what calls outside any handler made ready (an answer read at once
// by a send from a GTK signal); should such a handler itself wait for an
// answer, the library's loop alone runs during that wait, GLib's other
// sources pause. The library's own deferred work is announced on the
// descriptor and never runs there.
#ifndef NXBASE_GLIBLOOP_H_
#define NXBASE_GLIBLOOP_H_

#include <glib.h>

#include <cstdint>

#include "nxbase/export.h"

namespace nxbase::glib {

// Attaches the library's loop to `context` (null: the default main context)
// and returns the source's id. Attaching again first detaches the earlier
// source. Throws std::system_error when the loop descriptor cannot be made.
NXBASE_EXPORT guint Attach(GMainContext* context = nullptr);
// Removes the source and the nested wait; the library's waits then run its
// own loop alone again.
NXBASE_EXPORT void Detach();
// How often the source found the loop descriptor readable and dispatched,
// since it was attached: the application's wake-ups for the library.
NXBASE_EXPORT std::uint64_t WakeUps();

}  // namespace nxbase::glib

#endif  // NXBASE_GLIBLOOP_H_
