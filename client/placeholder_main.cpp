// Placeholder until the client tool lands.
int main() { return 1; }
