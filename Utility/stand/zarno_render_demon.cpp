// The render daemon: one per render host.
int main() { return 1; }
