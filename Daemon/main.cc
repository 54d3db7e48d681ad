// Placeholder entry until the process entry lands.
int main() { return 1; }
