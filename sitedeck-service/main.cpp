// Placeholder until the service spine lands.
int main() { return 1; }
