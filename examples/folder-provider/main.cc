#include "examples/folder-provider/FolderProvider.h"

int main() { return storix::runProviderExtension<storix::example::FolderProvider>(); }
