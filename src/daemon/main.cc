// Entry point of typhorad (being written).
int main() { return 0; }
