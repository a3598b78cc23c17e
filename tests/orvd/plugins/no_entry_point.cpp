// A library without the function that the server asks for.
extern "C" int something_else() {
  return 0;
}
