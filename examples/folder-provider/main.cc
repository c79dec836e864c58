#include "FolderProvider.h"

int main() { return storix::runProviderExtension<storix::example::FolderProvider>(); }
