// Not a module: a shared object without GetAPITable.
extern "C" int NotAModule(void) {
  return 1;
}
