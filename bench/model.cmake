# The plug-in model: form export and import, SDK resolution, issuing a file
# extension.
tenon_benchmark(model_bench SOURCES ModelBench.cpp LIBS tn_model tn_sandbox tn_log tn_value)
