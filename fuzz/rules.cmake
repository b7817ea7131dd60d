# Rules matching: rules dictionaries (from hosts' requests and entitlements)
# against the daemon's plug-in records, and activation rules.
tenon_fuzzer(rules SOURCES RulesFuzzer.cpp
  LIBS tnd_plugin tn_registrar_lookup tn_registrar tn_activation tn_types tn_model tn_log tn_value)
