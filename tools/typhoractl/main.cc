// Entry point of typhoractl (being written).
int main() { return 0; }
