// The plug-in module: the core library linked whole, so that the Qt plug-in metadata and the
// instance function of PluginDelvixSrv (generated with its meta-object) and the log
// registrations made at load are part of the module. This file only anchors the module.
#include "PluginDelvixSrv.h"

// Keeps a reference to the plug-in class in the module's own object code.
[[maybe_unused]] static const QMetaObject* const g_pluginMetaObject = &PluginDelvixSrv::staticMetaObject;
