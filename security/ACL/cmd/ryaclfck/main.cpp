// Placeholder entry point; the command line is being written.
int main() { return 99; }
