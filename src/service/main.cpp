// Composition root of the service.
int main() { return 0; }
