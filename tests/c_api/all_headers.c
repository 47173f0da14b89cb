/* Every public header included from C, to keep the interface plain C. */
#include "pellux/pellux.h"
#include "plano/plano.h"
#include "plano_host/host.h"

int main(void)
{
    Plx_Image image;
    Plx_Window w = {0, 0, 4, 4};
    (void)w;
    if (plx_image_form_gen_gl_uc(&image, 4, 4) == 0) return 1;
    plx_image_free(&image);
    return 0;
}
