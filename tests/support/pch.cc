// Carries the precompiled header shared by the test executables.
int main() { return 0; }
