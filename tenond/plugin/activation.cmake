# Activation: the service configuration and overlay that make a plug-in
# launchable for a host, and whether an instance of it is busy.
target_sources(tnd_plugin PRIVATE TNDPlugInActivation.cpp)
