// The POV-Ray demo scene: a ball rolling over a checkered floor.  Its clock
// runs from 0 to 1 over the frames of ball.ini.
#version 3.7;
global_settings { assumed_gamma 1.0 }
camera { location <0, 2, -6> look_at <0, 1, 0> }
light_source { <4, 8, -6> color rgb 1 }
plane { y, 0 pigment { checker rgb <0.2, 0.3, 0.5> rgb <0.9, 0.9, 0.8> } }
sphere { <-2 + 4 * clock, 1, 0>, 1 pigment { rgb <0.9, 0.3, 0.1> } }
