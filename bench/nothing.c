// What starting a program costs in any case.
int main(void) {
    return 0;
}
