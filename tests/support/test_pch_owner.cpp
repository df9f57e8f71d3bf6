// Owner of the tests precompiled header (see test_pch.h).
int main() {
  return 0;
}
