// The program that owns the test programs' shared precompiled header (see
// tests/CMakeLists.txt). It does nothing.
int main() { return 0; }
