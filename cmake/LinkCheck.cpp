// The program of a layer's link check (cmake/Layers.cmake): it calls
// nothing; linking it with every object of the layer is the check.

int main() {
    return 0;
}
