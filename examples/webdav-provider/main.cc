#include "examples/webdav-provider/WebDavProvider.h"

int main() { return storix::runProviderExtension<storix::example::WebDavProvider>(); }
