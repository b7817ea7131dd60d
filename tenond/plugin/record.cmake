# TNDPlugIn: the daemon's plug-in record over the registrar's records.
target_sources(tnd_plugin PRIVATE TNDPlugIn.cpp TNDPlugInForms.cpp)
target_link_libraries(tnd_plugin PUBLIC tn_model tn_registrar PRIVATE tn_log)
