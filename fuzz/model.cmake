# The plug-in model's untrusted inputs: plug-in forms (decoded from replies)
# and sandbox extension tokens.
tenon_fuzzer(plugin_form SOURCES PlugInFormFuzzer.cpp LIBS tn_model tn_log tn_value)
tenon_fuzzer(sandbox_token SOURCES SandboxTokenFuzzer.cpp LIBS tn_sandbox tn_value)
