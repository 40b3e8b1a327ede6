#include "apps/extensions/Panel.h"

#include <algorithm>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "apps/extensions/Extensions.h"
#include "platform/pcx/Pcx.h"

namespace annexa::extensions {

namespace {

// How long the panel waits after an event before it reads again: the events of one change (an
// application with several plug-ins) come together, and are read once.
constexpr guint kSettleMs = 15;
// How long it waits before following axd again after its watch ended (axd restarted).
constexpr guint kRewatchMs = 1000;

void setLabel(GtkWidget* widget, const std::string& label) {
    gtk_accessible_update_property(GTK_ACCESSIBLE(widget), GTK_ACCESSIBLE_PROPERTY_LABEL, label.c_str(), -1);
}

GtkWidget* plainRow(const std::string& title, const std::string& subtitle) {
    GtkWidget* row = adw_action_row_new();
    adw_preferences_row_set_use_markup(ADW_PREFERENCES_ROW(row), FALSE);
    adw_preferences_row_set_title(ADW_PREFERENCES_ROW(row), title.c_str());
    if (!subtitle.empty()) adw_action_row_set_subtitle(ADW_ACTION_ROW(row), subtitle.c_str());
    return row;
}

// A group's title and description are markup: names are escaped.
GtkWidget* group(const std::string& title, const std::string& description = {}) {
    GtkWidget* g = adw_preferences_group_new();
    g_autofree char* escapedTitle = g_markup_escape_text(title.c_str(), -1);
    adw_preferences_group_set_title(ADW_PREFERENCES_GROUP(g), escapedTitle);
    if (!description.empty()) {
        g_autofree char* escaped = g_markup_escape_text(description.c_str(), -1);
        adw_preferences_group_set_description(ADW_PREFERENCES_GROUP(g), escaped);
    }
    return g;
}

std::string rowSubtitle(const PlugIn& p) {
    std::string s = p.applicationName.empty() ? "Stand-alone" : p.applicationName;
    s += " · version " + p.version;
    if (p.held) s += " · on hold while its application changes";
    if (p.election != 0 && p.election != 1) s += " · stored choice " + std::to_string(p.election);
    return s;
}

struct Row {
    GtkWidget* row;
    GtkWidget* toggle;
};

struct Panel {
    Extensions model;
    Snapshot snapshot;
    GtkWidget* window = nullptr;
    GtkWidget* errorBar = nullptr;
    GtkWidget* errorLabel = nullptr;
    GtkWidget* limited = nullptr;
    GtkWidget* search = nullptr;
    GtkWidget* groups = nullptr;  // the box of extension-point groups
    std::map<UUID, Row> rows;
    // "Why is it not offered?"
    std::vector<Application> hosts;
    GtkWidget* hostRow = nullptr;
    GtkWidget* rulesRow = nullptr;
    GtkWidget* explanationBox = nullptr;
    GtkWidget* explanation = nullptr;
    bool updating = false;  // switches set by the panel itself, not by the user
    guint settle = 0;
};

void shortcut(GtkWidget* widget, guint key, GdkModifierType modifiers, GtkShortcutAction* action) {
    GtkEventController* keys = gtk_shortcut_controller_new();
    gtk_shortcut_controller_set_scope(GTK_SHORTCUT_CONTROLLER(keys), GTK_SHORTCUT_SCOPE_GLOBAL);
    gtk_shortcut_controller_add_shortcut(GTK_SHORTCUT_CONTROLLER(keys), gtk_shortcut_new(gtk_keyval_trigger_new(key, modifiers), action));
    gtk_widget_add_controller(widget, keys);
}

void showError(Panel& panel, const std::string& what, const corvane::Error& error) {
    std::string message = what + ": " + error.description();
    gtk_label_set_text(GTK_LABEL(panel.errorLabel), message.c_str());
    gtk_widget_set_visible(panel.errorBar, TRUE);
}

void reload(Panel& panel);
void refreshHosts(Panel& panel);
void openDetails(Panel& panel, const UUID& uuid);

// The plug-in a control stands for.
void attachUuid(GtkWidget* widget, const UUID& uuid) {
    g_object_set_data_full(G_OBJECT(widget), "uuid", new UUID(uuid), [](gpointer u) { delete static_cast<UUID*>(u); });
}
const UUID& attachedUuid(GtkWidget* widget) { return *static_cast<const UUID*>(g_object_get_data(G_OBJECT(widget), "uuid")); }

void electionToggled(GtkSwitch* toggle, GParamSpec*, gpointer data) {
    auto* panel = static_cast<Panel*>(data);
    if (panel->updating) return;
    bool on = gtk_switch_get_active(toggle);
    if (Status sent = panel->model.setElection(attachedUuid(GTK_WIDGET(toggle)), on); !sent.ok()) showError(*panel, "The choice was not stored", sent.error());
    // The row shows what axd stored, whatever was asked.
    reload(*panel);
}

GtkWidget* plugInRow(Panel& panel, const PlugIn& p) {
    GtkWidget* row = plainRow(p.name, rowSubtitle(p));
    GtkWidget* toggle = gtk_switch_new();
    gtk_widget_set_valign(toggle, GTK_ALIGN_CENTER);
    gtk_switch_set_active(GTK_SWITCH(toggle), p.elected());
    setLabel(toggle, "Use " + p.name);
    gtk_widget_set_tooltip_text(toggle, "Offer this plug-in to its hosts");
    attachUuid(toggle, p.uuid);
    g_signal_connect(toggle, "notify::active", G_CALLBACK(electionToggled), &panel);
    GtkWidget* details = gtk_button_new_from_icon_name("go-next-symbolic");
    gtk_widget_set_valign(details, GTK_ALIGN_CENTER);
    gtk_widget_add_css_class(details, "flat");
    setLabel(details, "Details of " + p.name);
    attachUuid(details, p.uuid);
    auto open = +[](GtkWidget* w, gpointer data) {
        openDetails(*static_cast<Panel*>(data), attachedUuid(w));
    };
    g_signal_connect(details, "clicked", G_CALLBACK(open), &panel);
    adw_action_row_add_suffix(ADW_ACTION_ROW(row), toggle);
    adw_action_row_add_suffix(ADW_ACTION_ROW(row), details);
    // Enter on the row, or a click on it, opens its page too.
    attachUuid(row, p.uuid);
    gtk_list_box_row_set_activatable(GTK_LIST_BOX_ROW(row), TRUE);
    g_signal_connect(row, "activated", G_CALLBACK(open), &panel);
    panel.rows[p.uuid] = Row{row, toggle};
    return row;
}

// Builds the groups anew: the plug-ins the search finds, by extension point.
void rebuild(Panel& panel) {
    GtkWidget* child;
    while ((child = gtk_widget_get_first_child(panel.groups))) gtk_box_remove(GTK_BOX(panel.groups), child);
    panel.rows.clear();
    std::string searched = gtk_editable_get_text(GTK_EDITABLE(panel.search));
    bool any = false;
    for (const Group& g : panel.snapshot.groups) {
        GtkWidget* box = nullptr;
        for (const PlugIn& p : g.plugIns) {
            if (!matchesSearch(p, searched)) continue;
            if (!box) {
                box = group(g.title, g.title == g.point ? std::string() : g.point);
                gtk_box_append(GTK_BOX(panel.groups), box);
            }
            adw_preferences_group_add(ADW_PREFERENCES_GROUP(box), plugInRow(panel, p));
            any = true;
        }
    }
    if (!any) {
        GtkWidget* none = gtk_label_new(searched.empty() ? "No plug-ins are installed." : "No plug-in has this name.");
        gtk_widget_add_css_class(none, "dim-label");
        gtk_box_append(GTK_BOX(panel.groups), none);
    }
}

// The same plug-ins in the same places: only their rows' texts and switches change.
bool sameLayout(const Snapshot& a, const Snapshot& b) {
    if (a.groups.size() != b.groups.size()) return false;
    for (size_t i = 0; i < a.groups.size(); ++i) {
        const auto& x = a.groups[i].plugIns;
        const auto& y = b.groups[i].plugIns;
        if (x.size() != y.size() || a.groups[i].point != b.groups[i].point) return false;
        for (size_t j = 0; j < x.size(); ++j)
            if (x[j].uuid != y[j].uuid || x[j].name != y[j].name) return false;
    }
    return true;
}

void update(Panel& panel) {
    panel.updating = true;
    for (const Group& g : panel.snapshot.groups) {
        for (const PlugIn& p : g.plugIns) {
            auto it = panel.rows.find(p.uuid);
            if (it == panel.rows.end()) continue;
            adw_action_row_set_subtitle(ADW_ACTION_ROW(it->second.row), rowSubtitle(p).c_str());
            gtk_switch_set_active(GTK_SWITCH(it->second.toggle), p.elected());
        }
    }
    panel.updating = false;
}

void reload(Panel& panel) {
    auto loaded = panel.model.load();
    if (!loaded) {
        showError(panel, "axd did not answer", loaded.error());
        return;
    }
    bool same = sameLayout(panel.snapshot, *loaded);
    panel.snapshot = std::move(*loaded);
    gtk_widget_set_visible(panel.limited, !panel.snapshot.fullView);
    refreshHosts(panel);
    if (same && !panel.rows.empty()) {
        update(panel);
    } else {
        panel.updating = true;
        rebuild(panel);
        panel.updating = false;
    }
}

// ---- a plug-in's page

void consentToggled(GtkSwitch* toggle, GParamSpec*, gpointer data) {
    auto* panel = static_cast<Panel*>(data);
    if (panel->updating) return;
    const char* application = static_cast<const char*>(g_object_get_data(G_OBJECT(toggle), "application"));
    const char* service = static_cast<const char*>(g_object_get_data(G_OBJECT(toggle), "service"));
    bool on = gtk_switch_get_active(toggle);
    if (Status set = panel->model.setConsent(application, service, on); !set.ok()) {
        showError(*panel, "The privacy choice was not stored", set.error());
        panel->updating = true;
        gtk_switch_set_active(toggle, !on);
        panel->updating = false;
        return;
    }
    // The keyboard's network decides its sandbox: the page shows the profile it gets now.
    auto* plugIn = static_cast<const PlugIn*>(g_object_get_data(G_OBJECT(toggle), "plug-in"));
    auto* profileRow = static_cast<GtkWidget*>(g_object_get_data(G_OBJECT(toggle), "profile-row"));
    if (plugIn && profileRow && std::string(service) == corvane::pcx::kKeyboardNetworkService) {
        auto [profile, why] = Extensions::sandboxProfile(*plugIn, on);
        adw_preferences_row_set_title(ADW_PREFERENCES_ROW(profileRow), ("Profile " + profile).c_str());
        adw_action_row_set_subtitle(ADW_ACTION_ROW(profileRow), why.c_str());
    }
}

void openDetails(Panel& panel, const UUID& uuid) {
    const PlugIn* found = panel.snapshot.find(uuid);
    if (!found) return;
    const PlugIn p = *found;
    GtkWidget* window = adw_window_new();
    gtk_window_set_transient_for(GTK_WINDOW(window), GTK_WINDOW(panel.window));
    gtk_window_set_modal(GTK_WINDOW(window), TRUE);
    gtk_window_set_default_size(GTK_WINDOW(window), 560, 620);
    gtk_window_set_title(GTK_WINDOW(window), p.name.c_str());
    shortcut(window, GDK_KEY_Escape, GdkModifierType(0), gtk_named_action_new("window.close"));
    GtkWidget* box = gtk_box_new(GTK_ORIENTATION_VERTICAL, 0);
    gtk_box_append(GTK_BOX(box), adw_header_bar_new());
    GtkWidget* page = adw_preferences_page_new();
    gtk_widget_set_vexpand(page, TRUE);
    gtk_box_append(GTK_BOX(box), page);
    adw_window_set_content(ADW_WINDOW(window), box);

    GtkWidget* about = group(p.name);
    for (const auto& [title, value] : std::vector<std::pair<std::string, std::string>>{
             {"Identifier", p.identifier},
             {"UUID", p.uuid.string()},
             {"Version", p.version},
             {"Path", p.path},
             {"Application", p.applicationName.empty() ? "none (stand-alone)" : p.applicationName + " (" + p.applicationPath + ")"},
             {"Extension point", p.pointTitle + (p.pointTitle == p.point ? "" : " (" + p.point + ")")},
         }) {
        adw_preferences_group_add(ADW_PREFERENCES_GROUP(about), plainRow(title, value));
    }
    adw_preferences_page_add(ADW_PREFERENCES_PAGE(page), ADW_PREFERENCES_GROUP(about));

    auto services = panel.model.consentServices(p, panel.snapshot);
    bool networkGranted = false;
    if (services)
        for (const ConsentService& s : *services)
            if (s.service == corvane::pcx::kKeyboardNetworkService) networkGranted = s.granted;
    auto [profile, why] = Extensions::sandboxProfile(p, networkGranted);
    GtkWidget* sandbox = group("Sandbox");
    GtkWidget* profileRow = plainRow("Profile " + profile, why);
    adw_preferences_group_add(ADW_PREFERENCES_GROUP(sandbox), profileRow);
    adw_preferences_page_add(ADW_PREFERENCES_PAGE(page), ADW_PREFERENCES_GROUP(sandbox));

    GtkWidget* rights = group("Entitlements");
    bool anyRight = false;
    if (const corvane::Dictionary* all = p.entitlements.asDictionary())
        for (const auto& [key, value] : *all)
            if (auto worded = wordEntitlement(key, value)) {
                adw_preferences_group_add(ADW_PREFERENCES_GROUP(rights), plainRow(*worded, key));
                anyRight = true;
            }
    if (!anyRight) adw_preferences_group_add(ADW_PREFERENCES_GROUP(rights), plainRow("None that concern you", ""));
    adw_preferences_page_add(ADW_PREFERENCES_PAGE(page), ADW_PREFERENCES_GROUP(rights));

    GtkWidget* privacy = group("Privacy", p.applicationName.empty() ? "" : "What " + p.applicationName + " may use");
    if (!services) {
        adw_preferences_group_add(ADW_PREFERENCES_GROUP(privacy), plainRow("Your privacy choices cannot be read", services.error().description()));
    } else if (services->empty()) {
        adw_preferences_group_add(ADW_PREFERENCES_GROUP(privacy), plainRow("Its application asked for nothing", ""));
    }
    for (const ConsentService& s : services ? *services : std::vector<ConsentService>{}) {
        GtkWidget* row = plainRow(s.title, s.service);
        GtkWidget* toggle = gtk_switch_new();
        gtk_widget_set_valign(toggle, GTK_ALIGN_CENTER);
        gtk_switch_set_active(GTK_SWITCH(toggle), s.granted);
        setLabel(toggle, "Allow " + s.title);
        g_object_set_data_full(G_OBJECT(toggle), "application", g_strdup(p.applicationPath.c_str()), g_free);
        g_object_set_data_full(G_OBJECT(toggle), "service", g_strdup(s.service.c_str()), g_free);
        g_object_set_data_full(G_OBJECT(toggle), "plug-in", new PlugIn(p), [](gpointer d) { delete static_cast<PlugIn*>(d); });
        g_object_set_data(G_OBJECT(toggle), "profile-row", profileRow);
        g_signal_connect(toggle, "notify::active", G_CALLBACK(consentToggled), &panel);
        adw_action_row_add_suffix(ADW_ACTION_ROW(row), toggle);
        adw_preferences_group_add(ADW_PREFERENCES_GROUP(privacy), row);
    }
    adw_preferences_page_add(ADW_PREFERENCES_PAGE(page), ADW_PREFERENCES_GROUP(privacy));
    gtk_window_present(GTK_WINDOW(window));
}

// ---- "Why is it not offered?"

void explain(Panel& panel) {
    guint chosen = adw_combo_row_get_selected(ADW_COMBO_ROW(panel.hostRow));
    std::string host = chosen >= 1 && chosen <= panel.hosts.size() ? panel.hosts[chosen - 1].path : std::string();
    if (panel.explanation) adw_preferences_page_remove(ADW_PREFERENCES_PAGE(panel.explanationBox), ADW_PREFERENCES_GROUP(panel.explanation));
    panel.explanation = group("What the host is told");
    adw_preferences_page_add(ADW_PREFERENCES_PAGE(panel.explanationBox), ADW_PREFERENCES_GROUP(panel.explanation));
    auto rules = parseRules(gtk_editable_get_text(GTK_EDITABLE(panel.rulesRow)));
    if (!rules) {
        showError(panel, "The rules cannot be read", rules.error());
        return;
    }
    auto explained = panel.model.explain(host, *rules, panel.snapshot);
    if (!explained) {
        showError(panel, "axd did not explain", explained.error());
        return;
    }
    for (const Explanation& e : *explained) {
        GtkWidget* row = plainRow(e.name, e.worded);
        gtk_widget_set_tooltip_text(row, e.outcome.c_str());
        GtkWidget* icon = gtk_image_new_from_icon_name(e.offered ? "emblem-ok-symbolic" : "action-unavailable-symbolic");
        setLabel(icon, e.offered ? "offered" : "not offered");
        adw_action_row_add_prefix(ADW_ACTION_ROW(row), icon);
        adw_preferences_group_add(ADW_PREFERENCES_GROUP(panel.explanation), row);
    }
}

// The registered applications as hosts to pick, read again when they may have changed; the one
// picked stays picked while it is registered.
void refreshHosts(Panel& panel) {
    std::vector<Application> hosts = panel.model.applications();
    bool same = hosts.size() == panel.hosts.size() && std::equal(hosts.begin(), hosts.end(), panel.hosts.begin(), [](auto& a, auto& b) {
                    return a.path == b.path && a.name == b.name;
                });
    if (same && adw_combo_row_get_model(ADW_COMBO_ROW(panel.hostRow))) return;
    guint chosen = adw_combo_row_get_selected(ADW_COMBO_ROW(panel.hostRow));
    std::string picked = chosen >= 1 && chosen <= panel.hosts.size() ? panel.hosts[chosen - 1].path : std::string();
    GtkStringList* names = gtk_string_list_new(nullptr);
    gtk_string_list_append(names, "This panel (no application)");
    guint keep = 0;
    for (size_t i = 0; i < hosts.size(); ++i) {
        gtk_string_list_append(names, hosts[i].name.c_str());
        if (hosts[i].path == picked) keep = static_cast<guint>(i + 1);
    }
    panel.hosts = std::move(hosts);
    panel.updating = true;
    adw_combo_row_set_model(ADW_COMBO_ROW(panel.hostRow), G_LIST_MODEL(names));
    g_object_unref(names);
    adw_combo_row_set_selected(ADW_COMBO_ROW(panel.hostRow), keep);
    panel.updating = false;
}

GtkWidget* explainPage(Panel& panel) {
    GtkWidget* page = adw_preferences_page_new();
    panel.explanationBox = page;
    GtkWidget* ask = group("Why is it not offered?",
                           "Pick the application that hosts plug-ins, or type the rules a host asks with; "
                           "axd says, for every plug-in, whether the host is offered it and if not, why.");
    panel.hostRow = adw_combo_row_new();
    adw_preferences_row_set_title(ADW_PREFERENCES_ROW(panel.hostRow), "Host application");
    refreshHosts(panel);
    g_signal_connect(panel.hostRow, "notify::selected", G_CALLBACK(+[](GObject*, GParamSpec*, gpointer data) {
                         auto& p = *static_cast<Panel*>(data);
                         if (!p.updating) explain(p);
                     }),
                     &panel);
    adw_preferences_group_add(ADW_PREFERENCES_GROUP(ask), panel.hostRow);
    panel.rulesRow = adw_entry_row_new();
    adw_preferences_row_set_title(ADW_PREFERENCES_ROW(panel.rulesRow), "Rules, e.g. {\"KSExtensionPointName\": \"Share\"}");
    setLabel(panel.rulesRow, "Host rules");
    g_signal_connect(panel.rulesRow, "entry-activated", G_CALLBACK(+[](AdwEntryRow*, gpointer data) {
                         explain(*static_cast<Panel*>(data));
                     }),
                     &panel);
    adw_entry_row_set_activates_default(ADW_ENTRY_ROW(panel.rulesRow), FALSE);
    adw_preferences_group_add(ADW_PREFERENCES_GROUP(ask), panel.rulesRow);
    GtkWidget* button = gtk_button_new_with_label("Explain");
    gtk_widget_set_halign(button, GTK_ALIGN_END);
    gtk_widget_set_margin_top(button, 12);
    gtk_widget_add_css_class(button, "suggested-action");
    g_signal_connect(button, "clicked", G_CALLBACK(+[](GtkButton*, gpointer data) { explain(*static_cast<Panel*>(data)); }), &panel);
    adw_preferences_group_add(ADW_PREFERENCES_GROUP(ask), button);
    adw_preferences_page_add(ADW_PREFERENCES_PAGE(page), ADW_PREFERENCES_GROUP(ask));
    return page;
}

// ---- following axd

void follow(Panel& panel);

void changed(Panel& panel, bool ended) {
    // From the watch's queue: the work is the main loop's.
    struct Change {
        Panel* panel;
        bool ended;
    };
    g_idle_add_once(
        [](gpointer data) {
            std::unique_ptr<Change> change(static_cast<Change*>(data));
            Panel& p = *change->panel;
            if (change->ended) {
                g_timeout_add_once(kRewatchMs, [](gpointer d) { follow(*static_cast<Panel*>(d)); }, &p);
                return;
            }
            if (p.settle) return;
            p.settle = g_timeout_add_once(kSettleMs, [](gpointer d) {
                auto& q = *static_cast<Panel*>(d);
                q.settle = 0;
                reload(q);
            }, &p);
        },
        new Change{&panel, ended});
}

void follow(Panel& panel) {
    Status watching = panel.model.startWatch([&panel](bool ended) { changed(panel, ended); });
    if (!watching.ok()) {
        showError(panel, "Changes are not followed", watching.error());
        g_timeout_add_once(kRewatchMs, [](gpointer d) { follow(*static_cast<Panel*>(d)); }, &panel);
        return;
    }
    gtk_widget_set_visible(panel.errorBar, FALSE);
    reload(panel);
}

GtkWidget* plugInsPage(Panel& panel) {
    GtkWidget* box = gtk_box_new(GTK_ORIENTATION_VERTICAL, 12);
    gtk_widget_set_margin_top(box, 12);
    gtk_widget_set_margin_bottom(box, 12);
    gtk_widget_set_margin_start(box, 12);
    gtk_widget_set_margin_end(box, 12);
    panel.limited = gtk_label_new(
        "This panel is not signed with the manager entitlement: it shows only the plug-ins axd offers it as a host.");
    gtk_label_set_wrap(GTK_LABEL(panel.limited), TRUE);
    gtk_widget_add_css_class(panel.limited, "warning");
    gtk_widget_set_visible(panel.limited, FALSE);
    gtk_box_append(GTK_BOX(box), panel.limited);
    panel.search = gtk_search_entry_new();
    g_object_set(panel.search, "placeholder-text", "Search plug-ins by name or identifier", nullptr);
    setLabel(panel.search, "Search plug-ins");
    g_signal_connect(panel.search, "search-changed", G_CALLBACK(+[](GtkSearchEntry*, gpointer data) {
                         auto& p = *static_cast<Panel*>(data);
                         p.updating = true;
                         rebuild(p);
                         p.updating = false;
                     }),
                     &panel);
    gtk_box_append(GTK_BOX(box), panel.search);
    panel.groups = gtk_box_new(GTK_ORIENTATION_VERTICAL, 18);
    gtk_box_append(GTK_BOX(box), panel.groups);
    GtkWidget* clamp = adw_clamp_new();
    adw_clamp_set_maximum_size(ADW_CLAMP(clamp), 760);
    adw_clamp_set_child(ADW_CLAMP(clamp), box);
    GtkWidget* scrolled = gtk_scrolled_window_new();
    gtk_scrolled_window_set_child(GTK_SCROLLED_WINDOW(scrolled), clamp);
    gtk_widget_set_vexpand(scrolled, TRUE);
    return scrolled;
}

GtkWidget* errorBar(Panel& panel) {
    panel.errorBar = gtk_box_new(GTK_ORIENTATION_HORIZONTAL, 6);
    gtk_widget_add_css_class(panel.errorBar, "toolbar");
    panel.errorLabel = gtk_label_new("");
    gtk_label_set_wrap(GTK_LABEL(panel.errorLabel), TRUE);
    gtk_label_set_xalign(GTK_LABEL(panel.errorLabel), 0);
    gtk_label_set_selectable(GTK_LABEL(panel.errorLabel), TRUE);
    gtk_widget_add_css_class(panel.errorLabel, "error");
    gtk_widget_set_hexpand(panel.errorLabel, TRUE);
    setLabel(panel.errorLabel, "Error");
    gtk_box_append(GTK_BOX(panel.errorBar), panel.errorLabel);
    GtkWidget* close = gtk_button_new_from_icon_name("window-close-symbolic");
    setLabel(close, "Dismiss the error");
    g_signal_connect(close, "clicked", G_CALLBACK(+[](GtkButton*, gpointer data) {
                         gtk_widget_set_visible(static_cast<Panel*>(data)->errorBar, FALSE);
                     }),
                     &panel);
    gtk_box_append(GTK_BOX(panel.errorBar), close);
    gtk_widget_set_visible(panel.errorBar, FALSE);
    return panel.errorBar;
}

}  // namespace

void presentPanel(AdwApplication* application) {
    // For the life of the process, which ends with its window: the watch's events refer to it.
    auto* panel = new Panel();
    panel->window = adw_application_window_new(GTK_APPLICATION(application));
    gtk_window_set_title(GTK_WINDOW(panel->window), "Extensions");
    gtk_window_set_default_size(GTK_WINDOW(panel->window), 760, 720);

    GtkWidget* stack = adw_view_stack_new();
    adw_view_stack_page_set_icon_name(adw_view_stack_add_titled(ADW_VIEW_STACK(stack), plugInsPage(*panel), "plugins", "Plug-ins"),
                                      "application-x-addon-symbolic");
    adw_view_stack_page_set_icon_name(
        adw_view_stack_add_titled(ADW_VIEW_STACK(stack), explainPage(*panel), "why", "Why is it not offered?"),
        "help-about-symbolic");
    GtkWidget* title = adw_view_switcher_title_new();
    adw_view_switcher_title_set_stack(ADW_VIEW_SWITCHER_TITLE(title), ADW_VIEW_STACK(stack));
    adw_view_switcher_title_set_title(ADW_VIEW_SWITCHER_TITLE(title), "Extensions");
    GtkWidget* header = adw_header_bar_new();
    adw_header_bar_set_title_widget(ADW_HEADER_BAR(header), title);
    GtkWidget* bottom = adw_view_switcher_bar_new();
    adw_view_switcher_bar_set_stack(ADW_VIEW_SWITCHER_BAR(bottom), ADW_VIEW_STACK(stack));
    g_object_bind_property(title, "title-visible", bottom, "reveal", G_BINDING_SYNC_CREATE);

    GtkWidget* content = gtk_box_new(GTK_ORIENTATION_VERTICAL, 0);
    gtk_box_append(GTK_BOX(content), header);
    gtk_box_append(GTK_BOX(content), errorBar(*panel));
    gtk_widget_set_vexpand(stack, TRUE);
    gtk_box_append(GTK_BOX(content), stack);
    gtk_box_append(GTK_BOX(content), bottom);
    adw_application_window_set_content(ADW_APPLICATION_WINDOW(panel->window), content);
    shortcut(panel->window, GDK_KEY_f, GDK_CONTROL_MASK, gtk_callback_action_new(
                                                      [](GtkWidget*, GVariant*, gpointer data) {
                                                          return gtk_widget_grab_focus(static_cast<Panel*>(data)->search);
                                                      },
                                                      panel, nullptr));
    follow(*panel);
    gtk_window_present(GTK_WINDOW(panel->window));
}

}  // namespace annexa::extensions
