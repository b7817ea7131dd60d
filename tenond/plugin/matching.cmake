# Matching rules dictionaries against TNDPlugIn: attribute patterns, type
# conformance and activation rules.
target_sources(tnd_plugin PRIVATE TNDMatchContext.cpp TNDPlugInMatching.cpp)
target_link_libraries(tnd_plugin PUBLIC tn_types PRIVATE tn_activation)
# Host authorization: may a host use a plug-in; its application's consents.
target_sources(tnd_plugin PRIVATE HostAuthorization.cpp)
target_link_libraries(tnd_plugin PRIVATE tn_privy)
