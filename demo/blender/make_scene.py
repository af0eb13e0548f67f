# Makes the Blender demo scene: a ball rolling over a floor, frames 1-6,
# 64x48 pixels, Cycles on the CPU with 4 samples and denoising on (as a
# studio's scene would have it; blender_render turns it off for the render).
#   blender -b --factory-startup --python make_scene.py -- OUT.blend
import bpy, sys
argv = sys.argv[sys.argv.index("--") + 1:] if "--" in sys.argv else []
out = argv[0]
bpy.ops.wm.read_factory_settings(use_empty=True)
sc = bpy.context.scene
sc.render.engine = 'CYCLES'
sc.cycles.device = 'CPU'
sc.cycles.samples = 4
sc.cycles.use_denoising = True
sc.render.resolution_x = 64
sc.render.resolution_y = 48
sc.render.resolution_percentage = 100
sc.frame_start = 1
sc.frame_end = 6
bpy.ops.mesh.primitive_uv_sphere_add(radius=1, location=(0, 0, 1))
ball = bpy.context.object
ball.keyframe_insert("location", frame=1)
ball.location = (2, 0, 1)
ball.keyframe_insert("location", frame=6)
bpy.ops.mesh.primitive_plane_add(size=10)
bpy.ops.object.light_add(type='SUN', location=(0, 0, 5))
bpy.ops.object.camera_add(location=(0, -8, 3), rotation=(1.25, 0, 0))
sc.camera = bpy.context.object
bpy.ops.wm.save_as_mainfile(filepath=out)
