// annexa-extensions: the user's Extensions panel (docs/extensions-panel.md).
#include <adwaita.h>

#include "apps/extensions/Panel.h"
#include "platform/log/Log.h"

int main(int argc, char** argv) {
    corvane::log::setStandardErrorFallback(true);
    AdwApplication* application = adw_application_new("com.corvane.annexa.Extensions", G_APPLICATION_DEFAULT_FLAGS);
    // A second start shows the window that is already there.
    g_signal_connect(application, "activate", G_CALLBACK(+[](GApplication* app, gpointer) {
                         if (GtkWindow* open = gtk_application_get_active_window(GTK_APPLICATION(app))) {
                             gtk_window_present(open);
                             return;
                         }
                         annexa::extensions::presentPanel(ADW_APPLICATION(app));
                     }),
                     nullptr);
    int status = g_application_run(G_APPLICATION(application), argc, argv);
    g_object_unref(application);
    return status;
}
